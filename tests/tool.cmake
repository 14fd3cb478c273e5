# The command-line tool, run as a program.
if(TARGET osutils_tool)
  find_package(nlohmann_json REQUIRED)
  add_executable(test_osutils test_osutils.cpp)
  target_link_libraries(test_osutils PRIVATE test_world nlohmann_json::nlohmann_json
                        GTest::gmock_main)
  target_compile_definitions(test_osutils PRIVATE
    OSUTILS_TOOL="$<TARGET_FILE:osutils_tool>" OSUTILS_VERSION="${PROJECT_VERSION}")
  add_dependencies(test_osutils osutils_tool)
  discover(test_osutils)
endif()
