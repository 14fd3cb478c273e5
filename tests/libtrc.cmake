# The program that test_libtrc runs with more rights than its user has.
if(OSUTILS_PLATFORM STREQUAL "bundled")
  add_executable(trc_secure trc_secure.cpp)
  target_link_libraries(trc_secure PRIVATE ${CMAKE_DL_LIBS})
  target_compile_definitions(test_libtrc PRIVATE SECURE_PROGRAM="$<TARGET_FILE:trc_secure>")
  add_dependencies(test_libtrc trc_secure)
endif()
