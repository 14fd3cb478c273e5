# The manual pages, the tool's description of itself, and what is made from it.
if(NOT TARGET osutils_reference)
  return()
endif()
set(reference ${CMAKE_CURRENT_SOURCE_DIR}/reference)
set(symbols ${PROJECT_BINARY_DIR}/libosutils/exported_symbols.txt)
add_test(NAME Reference.EverySymbolHasAPage COMMAND ${reference}/symbols_have_pages ${symbols} ${OSUTILS_MAN})
add_test(NAME Reference.ChecksFindWhatIsMissing COMMAND ${reference}/test_checks ${symbols} ${OSUTILS_MAN})
if(OSUTILS_PLATFORM STREQUAL "bundled")
  add_test(NAME Reference.Examples COMMAND ${reference}/examples ${PROJECT_SOURCE_DIR} $<TARGET_FILE_DIR:osutils>
                                           ${CMAKE_CXX_COMPILER})
endif()
add_test(NAME Reference.PagesRender COMMAND ${reference}/pages_render ${OSUTILS_MAN})
set_tests_properties(Reference.PagesRender PROPERTIES SKIP_RETURN_CODE 77)
