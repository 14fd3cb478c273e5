# The command-line tool, run as a program.
function(add_tool_test name)
  add_executable(${name} ${name}.cpp)
  target_link_libraries(${name} PRIVATE test_world nlohmann_json::nlohmann_json GTest::gmock_main)
  target_compile_definitions(${name} PRIVATE
    OSUTILS_TOOL="$<TARGET_FILE:osutils_tool>" OSUTILS_VERSION="${PROJECT_VERSION}")
  add_dependencies(${name} osutils_tool)
  discover(${name})
endfunction()

if(TARGET osutils_tool)
  find_package(nlohmann_json REQUIRED)
  add_tool_test(test_osutils)
  add_tool_test(test_osutils_arguments)
  add_tool_test(test_osutils_dry_run)
  add_tool_test(test_osutils_output)
  # Makes calls of the tool fail in the middle of an edit.
  add_library(edit_faults MODULE support/edit_faults.cpp)
  target_link_libraries(edit_faults PRIVATE ${CMAKE_DL_LIBS})
  add_tool_test(test_osutils_edits)
  add_dependencies(test_osutils_edits edit_faults)
  target_compile_definitions(test_osutils_edits PRIVATE EDIT_FAULTS="$<TARGET_FILE:edit_faults>")
endif()
