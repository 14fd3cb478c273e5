# The boundary: the headers, the exported symbols, and how the shared objects find and replace each other.
set(boundary ${CMAKE_CURRENT_SOURCE_DIR}/boundary)

add_test(NAME Boundary.Headers
         COMMAND ${boundary}/headers ${CMAKE_CXX_COMPILER} ${PROJECT_SOURCE_DIR})
add_test(NAME Boundary.Layers COMMAND ${boundary}/layers ${PROJECT_SOURCE_DIR})

if(OSUTILS_COVERAGE)
  message(STATUS "No tests of the exported symbols, of replacing libtrc and of the README's example: "
                 "instrumented code adds symbols and libraries of its own")
else()
  add_test(NAME Boundary.ExportedSymbols
           COMMAND ${boundary}/symbols $<TARGET_FILE:osutils> ${PROJECT_BINARY_DIR}/libosutils/exported_symbols.txt)
  if(OSUTILS_PLATFORM STREQUAL "bundled")
    add_test(NAME Boundary.DynamicSections
             COMMAND ${boundary}/dynamic_sections $<TARGET_FILE_DIR:osutils>)

    add_library(printing_libtrc SHARED boundary/printing_libtrc.cpp)
    set_target_properties(printing_libtrc PROPERTIES
      OUTPUT_NAME trc LIBRARY_OUTPUT_DIRECTORY ${CMAKE_CURRENT_BINARY_DIR}/printing_libtrc)
    add_executable(traced_client boundary/traced_client.cpp)
    add_executable(traced_client_with_libtrc boundary/traced_client.cpp boundary/printing_libtrc.cpp)
    foreach(client IN ITEMS traced_client traced_client_with_libtrc)
      target_link_libraries(${client} PRIVATE osutils)
      # With DT_RPATH, the program's own search would win over LD_LIBRARY_PATH.
      target_link_options(${client} PRIVATE -Wl,--enable-new-dtags)
    endforeach()
    add_test(NAME Boundary.LibtrcIsReplaceable
             COMMAND ${boundary}/replace_libtrc $<TARGET_FILE_DIR:osutils>
                     $<TARGET_FILE:printing_libtrc> $<TARGET_FILE:traced_client>
                     $<TARGET_FILE:traced_client_with_libtrc>)
    add_test(NAME Readme.Example
             COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/readme_example ${PROJECT_SOURCE_DIR}/README.md
                     ${CMAKE_CXX_COMPILER} $<TARGET_FILE_DIR:osutils>)
  endif()
endif()
