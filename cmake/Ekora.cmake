# Shared settings for every target of the project.
set(EKORA_WARNINGS -Wall -Wextra -Werror -Wno-missing-field-initializers)

if(EKORA_SANITIZE STREQUAL "thread" AND CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  # Asio's fences are invisible to the thread sanitizer; g++ warns about each of them.
  add_compile_options(-Wno-tsan)
endif()
if(EKORA_SANITIZE AND CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  # g++ 12 reports std::variant members as maybe uninitialised once sanitizers instrument
  # them; the plain build keeps the warning.
  add_compile_options(-Wno-maybe-uninitialized)
endif()
if(EKORA_SANITIZE)
  add_compile_options(-fsanitize=${EKORA_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${EKORA_SANITIZE})
endif()

# The programs of the package resolve every symbol at start and keep the relocated data
# read-only, as Debian links its own.
if(NOT EKORA_SANITIZE AND NOT EKORA_FUZZ)
  add_link_options(-Wl,-z,relro,-z,now)
endif()

# lld links the many test binaries several times faster than the default linker.
find_program(EKORA_LLD ld.lld)
option(EKORA_USE_LLD "Link with lld when it is installed" ON)
if(EKORA_USE_LLD AND EKORA_LLD)
  add_link_options(-fuse-ld=lld)
endif()

# ek_library(NAME SOURCES... DEPS ...): a static library of our own code.
function(ek_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;DEPS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_compile_options(${name} PRIVATE ${EKORA_WARNINGS})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
  target_link_libraries(${name} PUBLIC ${ARG_DEPS})
endfunction()

# A test file's own code is compiled without optimisation: optimising GoogleTest's macros is
# most of what compiling a test costs, and the code under test, in its libraries, keeps the
# build's optimisation.
set(EKORA_TEST_OPTIONS ${EKORA_WARNINGS} -O0)

# The headers every test file includes, compiled once for all of them.
function(ek_test_pch)
  if(TARGET ek_test_pch)
    return()
  endif()
  file(WRITE ${PROJECT_BINARY_DIR}/ek_test_pch.cpp "")
  add_library(ek_test_pch OBJECT ${PROJECT_BINARY_DIR}/ek_test_pch.cpp)
  target_compile_options(ek_test_pch PRIVATE ${EKORA_TEST_OPTIONS})
  target_link_libraries(ek_test_pch PRIVATE GTest::gtest GTest::gmock)
  target_precompile_headers(ek_test_pch PRIVATE <gtest/gtest.h> <gmock/gmock.h> <chrono>
    <functional> <map> <memory> <optional> <string> <thread> <variant> <vector>)
endfunction()

# ek_test(NAME SOURCES... DEPS ... [LABELS ...]): a GoogleTest binary registered with CTest.
# With EKORA_BUILD_TESTS off the binary is still defined (folders may refer to it) but neither
# built by default nor registered.
function(ek_test name)
  cmake_parse_arguments(ARG "" "" "SOURCES;DEPS;LABELS" ${ARGN})
  if(NOT EKORA_BUILD_TESTS)
    add_executable(${name} EXCLUDE_FROM_ALL ${ARG_SOURCES})
    target_link_libraries(${name} PRIVATE ${ARG_DEPS} GTest::gtest GTest::gtest_main GTest::gmock)
    return()
  endif()
  add_executable(${name} ${ARG_SOURCES})
  target_compile_options(${name} PRIVATE ${EKORA_TEST_OPTIONS})
  target_compile_definitions(${name} PRIVATE EXAMPLES_DIR="${PROJECT_SOURCE_DIR}/examples")
  target_link_libraries(${name} PRIVATE ${ARG_DEPS} GTest::gtest GTest::gtest_main GTest::gmock)
  ek_test_pch()
  target_precompile_headers(${name} REUSE_FROM ek_test_pch)
  include(GoogleTest)
  # One label per test binary: unit (default), concurrency (also run under the thread
  # sanitizer), e2e (starts the real daemon; also run under the thread sanitizer).
  if(NOT ARG_LABELS)
    set(ARG_LABELS unit)
  endif()
  # A second label would be read as the name of another test property and silently dropped.
  list(LENGTH ARG_LABELS label_count)
  if(NOT label_count EQUAL 1)
    message(FATAL_ERROR "ek_test(${name}): one label per test binary, not '${ARG_LABELS}'")
  endif()
  gtest_discover_tests(${name} PROPERTIES LABELS ${ARG_LABELS} DISCOVERY_TIMEOUT 60)
  ek_test_needs(${ARG_LABELS} ${name})
endfunction()

# ek_test_needs(LABEL TARGETS...): the tests labelled LABEL need TARGETS built. The target
# tests_LABEL (made by ek_test_targets) builds exactly those, so that a stage that runs one
# label builds no more than it runs.
function(ek_test_needs label)
  set_property(GLOBAL APPEND PROPERTY EK_TEST_LABELS ${label})
  set_property(GLOBAL APPEND PROPERTY EK_TEST_TARGETS_${label} ${ARGN})
endfunction()

# Called once at the end of the top-level list, when every test is known.
function(ek_test_targets)
  get_property(labels GLOBAL PROPERTY EK_TEST_LABELS)
  list(REMOVE_DUPLICATES labels)
  foreach(label IN LISTS labels)
    get_property(targets GLOBAL PROPERTY EK_TEST_TARGETS_${label})
    add_custom_target(tests_${label})
    add_dependencies(tests_${label} ${targets})
  endforeach()
endfunction()
