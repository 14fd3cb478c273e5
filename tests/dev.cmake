# The script for working on the project.
set(dev_tests help_changes_nothing surplus_arguments_change_nothing
    setup_all_installs_what_the_presets_need setup_all_unpacks_slapd_and_does_not_install_it
    demo_keeps_the_trace_of_its_last_run formats_without_git
    tests_the_release_build_without_an_argument keeps_the_reports_of_a_sanitizer
    fails_for_a_report_of_an_error
    fuzz_runs_every_target_from_its_seeds fuzz_fails_for_a_finding fuzz_fails_without_all_seeds fuzz_targets_are_apart is_apart_in_a_chroot
    takes_the_mirror_of_a_list takes_the_mirror_of_sources leaves_nothing_when_ended)
set(ratios "")
find_package(nlohmann_json QUIET)
if(nlohmann_json_FOUND)
  add_executable(test_ratios ${PROJECT_SOURCE_DIR}/bench/ratios.cpp)
  target_link_libraries(test_ratios PRIVATE nlohmann_json::nlohmann_json)
  list(APPEND dev_tests bench_counts_the_rows_that_missed bench_takes_the_median_of_whole_runs
       bench_bounds_the_longest_frame bench_says_why_a_page_was_not_measured
       bench_measures_only_the_groups_that_are_named bench_has_its_own_run_in_a_chroot)
  set(ratios $<TARGET_FILE:test_ratios>)
endif()
foreach(name IN LISTS dev_tests)
  add_test(NAME Dev.${name} COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/dev ${name} ${ratios})
  set_tests_properties(Dev.${name} PROPERTIES SKIP_RETURN_CODE 77 TIMEOUT 1500)
endforeach()

add_test(NAME Release.IsRefusedForEachFault COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/release)
set_tests_properties(Release.IsRefusedForEachFault PROPERTIES SKIP_RETURN_CODE 77 TIMEOUT 300)
