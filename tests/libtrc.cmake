# The libraries find the tests' own openat(), write() and clock_gettime().
set_target_properties(test_libtrc test_liborxldapdbg PROPERTIES ENABLE_EXPORTS ON)
# The program that test_libtrc runs with more rights than its user has.
add_executable(trc_secure trc_secure.cpp)
target_link_libraries(trc_secure PRIVATE ${CMAKE_DL_LIBS})
target_compile_definitions(test_libtrc PRIVATE SECURE_PROGRAM="$<TARGET_FILE:trc_secure>")
add_dependencies(test_libtrc trc_secure)
