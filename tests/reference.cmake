# The manual pages, the tool's description of itself, and what is made from it.
if(NOT TARGET osutils_reference)
  return()
endif()
set(reference ${CMAKE_CURRENT_SOURCE_DIR}/reference)
set(wrapper ${PROJECT_SOURCE_DIR}/libosutils/osutils.hpp)
set(symbols ${PROJECT_BINARY_DIR}/libosutils/exported_symbols.txt)
add_test(NAME Reference.EverySymbolHasAPage COMMAND ${reference}/symbols_have_pages ${symbols} ${OSUTILS_MAN} ${wrapper})
add_test(NAME Reference.ChecksFindWhatIsMissing COMMAND ${reference}/test_checks ${symbols} ${OSUTILS_MAN} ${wrapper}
                                                         ${OSUTILS_DESCRIPTION})
if(OSUTILS_PLATFORM STREQUAL "bundled")
  add_test(NAME Reference.Examples COMMAND ${reference}/examples ${PROJECT_SOURCE_DIR} $<TARGET_FILE_DIR:osutils>
                                           ${CMAKE_CXX_COMPILER})
endif()
add_test(NAME Reference.PagesRender COMMAND ${reference}/pages_render ${OSUTILS_MAN})
set_tests_properties(Reference.PagesRender PROPERTIES SKIP_RETURN_CODE 77)

if(TARGET osutils_tool_files)
  add_test(NAME Reference.EveryCommandHasAnEntry
           COMMAND ${reference}/commands_have_entries ${CMAKE_CURRENT_SOURCE_DIR}/osutils_help.txt
                   ${OSUTILS_MAN}/man1/osutils.1)
  add_test(NAME Reference.ToolExamples
           COMMAND ${reference}/tool_examples ${PROJECT_SOURCE_DIR}/packaging/reference/osutils.1.examples
                   $<TARGET_FILE_DIR:osutils_tool>)
  foreach(shell IN ITEMS bash zsh fish)
    add_test(NAME Completion.${shell}
             COMMAND ${reference}/completion ${shell} ${PROJECT_BINARY_DIR}/share ${OSUTILS_DESCRIPTION})
    set_tests_properties(Completion.${shell} PROPERTIES SKIP_RETURN_CODE 77)
  endforeach()
endif()
