# kova_add_test(NAME SOURCES file... [LIBS target...])
# Builds one GoogleTest program and registers each of its tests with CTest, so
# that every test case runs in a process of its own.
include(GoogleTest)

function(kova_add_test name)
  cmake_parse_arguments(arg "" "" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${arg_SOURCES})
  target_link_libraries(${name} PRIVATE ${arg_LIBS} kova_test_support GTest::gmock GTest::gtest_main)
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST)
endfunction()
