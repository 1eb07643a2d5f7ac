# veltoid_room(NAME SOURCES ... [TESTS ...] [DEPENDS ...] [TEST_DEPENDS ...])
#
# A room is a static library plus one test program for the tests that stand beside its code. Every test case runs
# in a process of its own, so that process-wide state is fresh for each.
find_package(GTest REQUIRED)
include(GoogleTest)

# Tests are compiled for a quick build: what is optimised is the code under test. GoogleTest's macros trip two warnings in
# perfectly good tests.
set(VELTOID_TEST_OPTIONS -O0 -U_FORTIFY_SOURCE -Wno-undef -Wno-shadow)

# What most sources include, compiled once: always for tests, for other sources only in builds whose speed matters more
# than that each source names all it uses.
set(VELTOID_COMMON_HEADERS
  <algorithm> <atomic> <cstdint> <functional> <map> <memory> <mutex> <optional> <string> <string_view> <utility> <variant> <vector>)
file(CONFIGURE OUTPUT ${CMAKE_BINARY_DIR}/precompiled.cpp CONTENT "int main() {}\n")
if(VELTOID_PRECOMPILE)
  add_library(precompiled OBJECT ${CMAKE_BINARY_DIR}/precompiled.cpp)
  target_precompile_headers(precompiled PRIVATE ${VELTOID_COMMON_HEADERS})
endif()
if(BUILD_TESTING AND NOT VELTOID_FUZZ)
  # Libraries and programs are compiled as position-independent in different ways.
  add_executable(precompiled_test ${CMAKE_BINARY_DIR}/precompiled.cpp)
  target_precompile_headers(precompiled_test
    PRIVATE ${VELTOID_COMMON_HEADERS} <gtest/gtest.h> <filesystem> <fstream>)
  target_compile_options(precompiled_test PRIVATE ${VELTOID_TEST_OPTIONS})
  target_link_libraries(precompiled_test PRIVATE GTest::gtest)
endif()

function(veltoid_test_program name)
  cmake_parse_arguments(ARG "" "" "SOURCES;DEPENDS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR} ${PROJECT_SOURCE_DIR}/VeltoIDAuthentication)
  target_link_libraries(${name} PRIVATE ${ARG_DEPENDS} TestMain)
  target_compile_options(${name} PRIVATE ${VELTOID_TEST_OPTIONS})
  target_precompile_headers(${name} REUSE_FROM precompiled_test)
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST PROPERTIES TIMEOUT 120)
endfunction()

function(veltoid_room name)
  cmake_parse_arguments(ARG "" "" "SOURCES;TESTS;DEPENDS;TEST_DEPENDS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR} ${PROJECT_SOURCE_DIR}/VeltoIDAuthentication)
  target_link_libraries(${name} PUBLIC ${ARG_DEPENDS})
  if(VELTOID_PRECOMPILE)
    target_precompile_headers(${name} REUSE_FROM precompiled)
  endif()
  if(ARG_TESTS AND BUILD_TESTING AND NOT VELTOID_FUZZ)
    veltoid_test_program(${name}_test SOURCES ${ARG_TESTS} DEPENDS ${name} ${ARG_TEST_DEPENDS})
  endif()
endfunction()
