# veltoid_room(NAME SOURCES ... [TESTS ...] [DEPENDS ...] [TEST_DEPENDS ...])
#
# A room is a static library plus one test program for the tests that stand beside its code. Every test case runs
# in a process of its own, so that process-wide state is fresh for each.
find_package(GTest REQUIRED)
include(GoogleTest)

function(veltoid_test_program name)
  cmake_parse_arguments(ARG "" "" "SOURCES;DEPENDS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR} ${PROJECT_SOURCE_DIR}/VeltoIDAuthentication)
  target_link_libraries(${name} PRIVATE ${ARG_DEPENDS} TestMain)
  # GoogleTest's macros trip these two in perfectly good tests.
  target_compile_options(${name} PRIVATE -Wno-undef -Wno-shadow)
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST PROPERTIES TIMEOUT 120)
endfunction()

function(veltoid_room name)
  cmake_parse_arguments(ARG "" "" "SOURCES;TESTS;DEPENDS;TEST_DEPENDS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR} ${PROJECT_SOURCE_DIR}/VeltoIDAuthentication)
  target_link_libraries(${name} PUBLIC ${ARG_DEPENDS})
  if(ARG_TESTS AND BUILD_TESTING AND NOT VELTOID_FUZZ)
    veltoid_test_program(${name}_test SOURCES ${ARG_TESTS} DEPENDS ${name} ${ARG_TEST_DEPENDS})
  endif()
endfunction()
