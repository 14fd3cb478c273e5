# Every exported function while its calls fail.
add_library(scenarios STATIC
  scenarios/scenario.cpp
  scenarios/accounts.cpp
  scenarios/directories.cpp
  scenarios/edits.cpp
  scenarios/environment.cpp
  scenarios/files.cpp
  scenarios/hosts.cpp
  scenarios/inittab.cpp
  scenarios/libraries.cpp
  scenarios/names.cpp
  scenarios/network.cpp
  scenarios/processes.cpp
  scenarios/services.cpp
  scenarios/trace.cpp)
target_include_directories(scenarios PUBLIC ${CMAKE_CURRENT_SOURCE_DIR}/scenarios)
target_link_libraries(scenarios PUBLIC osutils osutils::ldtr test_world)
target_compile_definitions(scenarios PRIVATE
  EXPORTED_SYMBOLS="${PROJECT_SOURCE_DIR}/packaging/exported_symbols.txt")
add_executable(faults faults/faults.cpp faults/imports.cpp faults/subject_library.cpp support/replaced_loader.cpp)
target_compile_definitions(faults PRIVATE IMPORTS="${CMAKE_CURRENT_SOURCE_DIR}/faults/imports.txt")
target_link_libraries(faults PRIVATE $<LINK_LIBRARY:WHOLE_ARCHIVE,test_support> scenarios)
set_target_properties(faults PROPERTIES ENABLE_EXPORTS ON)
if(OSUTILS_PLATFORM STREQUAL "bundled")
  add_executable(faults_platform
    faults/faults.cpp
    faults/imports.cpp
    faults/subject_platform.cpp
    support/faults.cpp
    support/replaced_calls.cpp
    support/replaced_files.cpp
    support/replaced_memory.cpp
    support/replaced_tool.cpp)
  target_compile_definitions(faults_platform PRIVATE IMPORTS="${CMAKE_CURRENT_SOURCE_DIR}/faults/imports.txt")
  target_include_directories(faults_platform PRIVATE ${PROJECT_SOURCE_DIR}/platform)
  target_link_libraries(faults_platform PRIVATE scenarios ${CMAKE_DL_LIBS})
  set_target_properties(faults_platform PROPERTIES ENABLE_EXPORTS ON)
endif()
if(NOT OSUTILS_COVERAGE)  # which adds imports of its own
  add_test(NAME Faults.HaveAScenarioForEveryFunction COMMAND faults check)
  add_test(NAME Faults.KnowWhichCallsOfTheLibraryCanFail COMMAND faults imports)
  if(TARGET faults_platform)
    add_test(NAME Faults.KnowWhichCallsOfThePlatformLibrariesCanFail COMMAND faults_platform imports)
  endif()
endif()
add_executable(run_scenario faults/run_scenario.cpp)
target_link_libraries(run_scenario PRIVATE scenarios)
if(TARGET osutils_tool)
  add_library(stop_at_main MODULE faults/stop_at_main.cpp)
  target_link_libraries(stop_at_main PRIVATE ${CMAKE_DL_LIBS})
  add_executable(strace_faults
    faults/strace_faults.cpp faults/strace_run.cpp faults/strace_commands.cpp
    faults/strace_functions.cpp)
  target_link_libraries(strace_faults PRIVATE test_world Threads::Threads)
  target_compile_definitions(strace_faults PRIVATE
    OSUTILS_TOOL="$<TARGET_FILE:osutils_tool>" RUN_SCENARIO="$<TARGET_FILE:run_scenario>"
    STOP_AT_MAIN="$<TARGET_FILE:stop_at_main>" APART="${CMAKE_CURRENT_SOURCE_DIR}/apart")
  add_dependencies(strace_faults osutils_tool run_scenario stop_at_main)
  if(TARGET osutils_trace)
    target_compile_definitions(strace_faults PRIVATE OSUTILS_TRACE="$<TARGET_FILE:osutils_trace>")
    target_include_directories(strace_faults PRIVATE ${PROJECT_SOURCE_DIR}/platform)
    add_dependencies(strace_faults osutils_trace)
  endif()
endif()
