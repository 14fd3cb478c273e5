# The libraries must find the calls that the tests replace.
set_target_properties(test_libtrc test_liborxldapdbg PROPERTIES ENABLE_EXPORTS ON)
# The program that test_libtrc runs with the set-group-ID bit.
add_executable(trc_secure trc_secure.cpp)
target_link_libraries(trc_secure PRIVATE ${CMAKE_DL_LIBS})
target_compile_definitions(test_libtrc PRIVATE SECURE_PROGRAM="$<TARGET_FILE:trc_secure>")
add_dependencies(test_libtrc trc_secure)
# The runtimes of the sanitizers make some of the replaced calls before instrumented code can run.
if(OSUTILS_SANITIZE)
  set_source_files_properties(test_libtrc_calls.cpp PROPERTIES
    SKIP_UNITY_BUILD_INCLUSION ON SKIP_PRECOMPILE_HEADERS ON
    COMPILE_OPTIONS "-fno-sanitize=all;-fno-threadsafe-statics")
endif()
