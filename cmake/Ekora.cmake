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

# ek_library(NAME SOURCES... DEPS ...): a static library of our own code.
function(ek_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;DEPS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_compile_options(${name} PRIVATE ${EKORA_WARNINGS})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
  target_link_libraries(${name} PUBLIC ${ARG_DEPS})
endfunction()

# ek_test(NAME SOURCES... DEPS ... [LABELS ...]): a GoogleTest binary registered with CTest.
function(ek_test name)
  cmake_parse_arguments(ARG "" "" "SOURCES;DEPS;LABELS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_compile_options(${name} PRIVATE ${EKORA_WARNINGS})
  target_link_libraries(${name} PRIVATE ${ARG_DEPS} GTest::gtest GTest::gtest_main GTest::gmock)
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
endfunction()
