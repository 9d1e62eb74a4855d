# fbf_add_test(NAME src.cc... LIBS target... [TIMEOUT s] [PER_CASE])
# One GoogleTest executable per folder under test. Registered with CTest as a
# whole, so the suite stays fast to enumerate on small machines; PER_CASE
# registers each case on its own instead, for the groups whose cases mostly
# wait on the real programs, so that CTest can overlap them.
include(GoogleTest)
function(fbf_add_test name)
  cmake_parse_arguments(ARG "PER_CASE" "TIMEOUT" "LIBS" ${ARGN})
  add_executable(${name} ${ARG_UNPARSED_ARGUMENTS})
  set_target_properties(${name} PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/tests)
  target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR}/tests ${PROJECT_SOURCE_DIR}/src)
  target_link_libraries(${name} PRIVATE ${ARG_LIBS} fbf_testsupport GTest::gtest GTest::gmock GTest::gtest_main)
  if(NOT ARG_TIMEOUT)
    set(ARG_TIMEOUT 300)
  endif()
  if(ARG_PER_CASE)
    gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST TEST_PREFIX "${name}." WORKING_DIRECTORY ${CMAKE_BINARY_DIR}
      PROPERTIES TIMEOUT ${ARG_TIMEOUT} ENVIRONMENT "FBF_BIN_DIR=${CMAKE_BINARY_DIR}/bin")
  else()
    add_test(NAME ${name} COMMAND ${name})
    set_tests_properties(${name} PROPERTIES TIMEOUT ${ARG_TIMEOUT}
      ENVIRONMENT "FBF_BIN_DIR=${CMAKE_BINARY_DIR}/bin;FBF_SOURCE_DIR=${PROJECT_SOURCE_DIR}")
  endif()
endfunction()
