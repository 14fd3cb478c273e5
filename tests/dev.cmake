# The script for working on the project.
foreach(name IN ITEMS help_changes_nothing surplus_arguments_change_nothing
        setup_all_installs_what_the_presets_need formats_without_git
        tests_the_release_build_without_an_argument keeps_the_reports_of_a_sanitizer
        fails_for_a_report_of_an_error
        takes_the_mirror_of_a_list takes_the_mirror_of_sources leaves_nothing_when_ended)
  add_test(NAME Dev.${name} COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/dev ${name})
  set_tests_properties(Dev.${name} PROPERTIES SKIP_RETURN_CODE 77 TIMEOUT 300)
endforeach()
