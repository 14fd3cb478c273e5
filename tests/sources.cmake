# The reference pages are made from the headers' comments.
add_test(NAME HeaderComments.HaveTheirForm
         COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/header_comments ${PROJECT_SOURCE_DIR}/libosutils/osutils.h
                 ${PROJECT_SOURCE_DIR}/libosutils/osutils.hpp
                 ${PROJECT_SOURCE_DIR}/libldap/ldap_clientosutils.h ${PROJECT_SOURCE_DIR}/libldtr/ldtr.h)
add_test(NAME HeaderComments.OfAnotherFormAreRefused
         COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/test_header_comments ${CMAKE_CURRENT_SOURCE_DIR}/header_comments)
add_test(NAME OsutilsHpp.EveryFunctionHasATest
         COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/hpp_has_tests ${PROJECT_SOURCE_DIR}/libosutils/osutils.hpp
                 ${CMAKE_CURRENT_SOURCE_DIR}/test_osutils_hpp.cpp)

# Which small changes `dev mutants` makes.
if(EXISTS /usr/bin/python3)
  add_test(NAME Mutants.AreMadeOfASource
           COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/mutants/test_candidates ${CMAKE_CXX_COMPILER})
  set_tests_properties(Mutants.AreMadeOfASource PROPERTIES SKIP_RETURN_CODE 77)
  add_test(NAME Mutants.ThatNoTestCanObserveCanBeMade
           COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/mutants/test_unobservable)
endif()
