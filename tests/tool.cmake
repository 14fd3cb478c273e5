# The command-line tool, run as a program.
function(add_tool_test family)
  set(name test_osutils_${family})
  add_executable(${name} ${name}.cpp)
  target_link_libraries(${name} PRIVATE test_world nlohmann_json::nlohmann_json GTest::gmock_main)
  target_compile_definitions(${name} PRIVATE
    OSUTILS_TOOL="$<TARGET_FILE:osutils_tool>" OSUTILS_VERSION="${PROJECT_VERSION}"
    EDIT_FAULTS="$<TARGET_FILE:edit_faults>" $<$<TARGET_EXISTS:osutils_trace>:READS_TRACES>)
  add_dependencies(${name} osutils_tool edit_faults)
  if(family STREQUAL "accounts")
    target_precompile_headers(${name} PRIVATE ${common_headers} <nlohmann/json.hpp>)
  else()
    target_precompile_headers(${name} REUSE_FROM test_osutils_accounts)
  endif()
  discover(${name})
endfunction()

if(TARGET osutils_tool)
  find_package(nlohmann_json REQUIRED)
  # Makes calls of the tool fail in the middle of an edit.
  add_library(edit_faults MODULE support/edit_faults.cpp)
  target_link_libraries(edit_faults PRIVATE ${CMAKE_DL_LIBS})
  foreach(family IN ITEMS accounts arguments checks difference dry_run edit_faults edits files help inittab
          names network output paths processes services signals trace)
    add_tool_test(${family})
  endforeach()
  # Every command while its calls fail. A sanitizer owns some of the calls.
  if(NOT OSUTILS_SANITIZE)
    add_library(tool_faults_preload MODULE faults/tool_faults_preload.cpp
      support/faults.cpp support/replaced_calls.cpp support/replaced_files.cpp support/replaced_memory.cpp
      support/replaced_platform.cpp support/replaced_tool.cpp)
    target_include_directories(tool_faults_preload PRIVATE support scenarios ${PROJECT_SOURCE_DIR}/platform)
    # The first use of another thread-local variable would allocate it.
    target_compile_options(tool_faults_preload PRIVATE -ftls-model=initial-exec)
    target_link_libraries(tool_faults_preload PRIVATE ${CMAKE_DL_LIBS})
    add_executable(tool_faults faults/tool_faults.cpp faults/tool_scenarios.cpp)
    target_include_directories(tool_faults PRIVATE scenarios)
    target_link_libraries(tool_faults PRIVATE test_world Threads::Threads)
    target_compile_definitions(tool_faults PRIVATE
      OSUTILS_TOOL="$<TARGET_FILE:osutils_tool>" PRELOAD="$<TARGET_FILE:tool_faults_preload>")
    target_include_directories(tool_faults PRIVATE ${PROJECT_SOURCE_DIR}/platform)
    if(TARGET osutils_trace)
      target_compile_definitions(tool_faults PRIVATE OSUTILS_TRACE="$<TARGET_FILE:osutils_trace>")
    endif()
    add_dependencies(tool_faults osutils_tool tool_faults_preload)
    add_test(NAME ToolFaults.EveryCommandHasAScenario COMMAND tool_faults check)
  endif()
  if(TARGET osutils_trace)
    # Changes a trace while it is read.
    add_library(second_reading MODULE support/second_reading.cpp)
    target_include_directories(second_reading PRIVATE ${BABELTRACE2_INCLUDE_DIR})
    target_link_libraries(second_reading PRIVATE ${CMAKE_DL_LIBS})
    foreach(view IN ITEMS export program reading report summary tree values)
      add_tool_test(trace_${view})
      target_include_directories(test_osutils_trace_${view} PRIVATE ${PROJECT_SOURCE_DIR}/platform)
    endforeach()
    foreach(view IN ITEMS export program report)
      add_dependencies(test_osutils_trace_${view} second_reading)
      target_compile_definitions(test_osutils_trace_${view} PRIVATE
        SECOND_READING="$<TARGET_FILE:second_reading>")
    endforeach()
    add_subdirectory(browser)
    add_test(NAME Tracing.Examples
             COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/tracing_examples ${PROJECT_SOURCE_DIR}/docs/tracing.md
                     $<TARGET_FILE_DIR:osutils_tool>)
    set_tests_properties(Tracing.Examples PROPERTIES SKIP_RETURN_CODE 77)
  endif()
  target_compile_definitions(test_osutils_help PRIVATE
    HELP_TEXTS="${CMAKE_CURRENT_SOURCE_DIR}/osutils_help.txt")
  if(TARGET surroundings)
    add_tool_test(surroundings)
    target_link_libraries(test_osutils_surroundings PRIVATE surroundings)
  endif()
  add_library(incomplete_module MODULE support/incomplete_module.cpp)
  target_link_options(incomplete_module PRIVATE -Wl,-z,lazy)
  add_dependencies(test_osutils_processes incomplete_module)
  target_compile_definitions(test_osutils_processes PRIVATE INCOMPLETE_MODULE="$<TARGET_FILE:incomplete_module>")
  add_library(storm_preload MODULE support/storm_preload.cpp)
  add_dependencies(test_osutils_signals storm_preload)
  target_compile_definitions(test_osutils_signals PRIVATE STORM_PRELOAD="$<TARGET_FILE:storm_preload>")
endif()
