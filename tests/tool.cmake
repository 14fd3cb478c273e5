# The command-line tool, run as a program.
function(add_tool_test family)
  set(name test_osutils_${family})
  add_executable(${name} ${name}.cpp)
  target_link_libraries(${name} PRIVATE test_world nlohmann_json::nlohmann_json GTest::gmock_main)
  target_compile_definitions(${name} PRIVATE
    OSUTILS_TOOL="$<TARGET_FILE:osutils_tool>" OSUTILS_VERSION="${PROJECT_VERSION}"
    EDIT_FAULTS="$<TARGET_FILE:edit_faults>")
  add_dependencies(${name} osutils_tool edit_faults)
  discover(${name})
endfunction()

if(TARGET osutils_tool)
  find_package(nlohmann_json REQUIRED)
  # Makes calls of the tool fail in the middle of an edit.
  add_library(edit_faults MODULE support/edit_faults.cpp)
  target_link_libraries(edit_faults PRIVATE ${CMAKE_DL_LIBS})
  foreach(family IN ITEMS accounts arguments checks dry_run edit_faults edits files inittab names network
          output paths processes services signals trace)
    add_tool_test(${family})
  endforeach()
  if(TARGET surroundings)
    add_tool_test(surroundings)
    target_link_libraries(test_osutils_surroundings PRIVATE surroundings)
  endif()
  add_library(storm_preload MODULE support/storm_preload.cpp)
  add_dependencies(test_osutils_signals storm_preload)
  target_compile_definitions(test_osutils_signals PRIVATE STORM_PRELOAD="$<TARGET_FILE:storm_preload>")
endif()
