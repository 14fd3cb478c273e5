# The documents: what they show works, and what they name is there. Their programs are built without instrumentation.
if(OSUTILS_COVERAGE OR OSUTILS_MUTANTS)
  return()
endif()
find_package(Python3 3.9 QUIET COMPONENTS Interpreter)
if(NOT Python3_FOUND)
  message(STATUS "No tests of the documents: they need python3")
  return()
endif()
set(docs ${CMAKE_CURRENT_SOURCE_DIR}/docs)
if(TARGET osutils_trace AND OSUTILS_PLATFORM STREQUAL "bundled")
  set(build ${PROJECT_SOURCE_DIR} $<TARGET_FILE_DIR:osutils> $<TARGET_FILE_DIR:osutils_tool> ${CMAKE_CXX_COMPILER})
  add_test(NAME Docs.Cookbook COMMAND Python3::Interpreter -B ${docs}/cookbook ${build})
  add_test(NAME Docs.Security COMMAND Python3::Interpreter -B ${docs}/security ${build})
  add_test(NAME Docs.Schemas COMMAND Python3::Interpreter -B ${docs}/schemas ${build})
  set_tests_properties(Docs.Schemas PROPERTIES SKIP_RETURN_CODE 77)
endif()
if(OSUTILS_PLATFORM STREQUAL "bundled" AND CMAKE_NM)
  add_test(NAME Docs.Architecture
           COMMAND Python3::Interpreter -B ${docs}/architecture ${PROJECT_SOURCE_DIR} ${CMAKE_NM}
                   $<TARGET_FILE_DIR:osutils>/osutils $<TARGET_OBJECTS:osutils>
           COMMAND_EXPAND_LISTS)
endif()
add_test(NAME Docs.PictureIsUpToDate COMMAND ${docs}/picture_is_up_to_date ${PROJECT_SOURCE_DIR}/docs)
