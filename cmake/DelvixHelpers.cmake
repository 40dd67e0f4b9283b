# Helper functions so that adding a library, a test or a benchmark is one call.

set(DELVIX_WARNINGS -Wall -Wextra)

# How many times slower than a plain build the tests run (ThreadSanitizer most), listing included.
set(DELVIX_TEST_TIME_SCALE 1)
if(DELVIX_SANITIZE STREQUAL "thread")
  set(DELVIX_TEST_TIME_SCALE 4)
elseif(DELVIX_SANITIZE STREQUAL "address")
  set(DELVIX_TEST_TIME_SCALE 2)
endif()

function(delvix_setup_sanitizers)
  if(DELVIX_SANITIZE STREQUAL "address")
    add_compile_options(-fsanitize=address,undefined -fno-omit-frame-pointer -fno-sanitize-recover=undefined)
    add_link_options(-fsanitize=address,undefined)
  elseif(DELVIX_SANITIZE STREQUAL "thread")
    add_compile_options(-fsanitize=thread -fno-omit-frame-pointer)
    add_link_options(-fsanitize=thread)
  elseif(NOT DELVIX_SANITIZE STREQUAL "")
    message(FATAL_ERROR "DELVIX_SANITIZE must be empty, 'address' or 'thread'")
  endif()
endfunction()

# delvix_library(NAME [STATIC|SHARED|MODULE|INTERFACE] SOURCES ... [LIBS ...] [INCLUDE dir])
# The folder of the calling CMakeLists.txt is the public include directory unless INCLUDE says otherwise.
function(delvix_library name)
  cmake_parse_arguments(ARG "STATIC;SHARED;MODULE;INTERFACE" "INCLUDE" "SOURCES;LIBS;PRIVATE_LIBS" ${ARGN})
  set(include_dir ${CMAKE_CURRENT_SOURCE_DIR})
  if(ARG_INCLUDE)
    set(include_dir ${ARG_INCLUDE})
  endif()
  if(ARG_INTERFACE)
    add_library(${name} INTERFACE)
    target_include_directories(${name} INTERFACE ${include_dir})
    target_link_libraries(${name} INTERFACE ${ARG_LIBS})
    return()
  endif()
  set(kind STATIC)
  if(ARG_SHARED)
    set(kind SHARED)
  elseif(ARG_MODULE)
    set(kind MODULE)
  endif()
  add_library(${name} ${kind} ${ARG_SOURCES})
  target_include_directories(${name} PUBLIC ${include_dir})
  target_link_libraries(${name} PUBLIC ${ARG_LIBS} PRIVATE ${ARG_PRIVATE_LIBS})
  target_compile_options(${name} PRIVATE ${DELVIX_WARNINGS})
endfunction()

# delvix_test(NAME SOURCES ... [LIBS ...] [QT_MAIN]) builds a GoogleTest executable and
# registers every test case with CTest. Tests get the shared main (with a
# QCoreApplication) from delvix_test_support unless they bring their own.
function(delvix_test name)
  cmake_parse_arguments(ARG "NO_LEAK_CHECK" "TIMEOUT" "SOURCES;LIBS;DEFINES" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_link_libraries(${name} PRIVATE delvix_test_support ${ARG_LIBS})
  target_compile_options(${name} PRIVATE ${DELVIX_WARNINGS})
  target_compile_definitions(${name} PRIVATE ${ARG_DEFINES})
  set(timeout 120)
  if(ARG_TIMEOUT)
    set(timeout ${ARG_TIMEOUT})
  endif()
  # Instrumented builds run several times slower: the same factor scales CTest's limit and, through
  # DELVIX_TEST_TIME_SCALE (set on the test support library), the waits inside the tests.
  set(discovery 5)
  if(DELVIX_TEST_TIME_SCALE GREATER 1)
    set(discovery 60)
  endif()
  math(EXPR timeout "${timeout} * ${DELVIX_TEST_TIME_SCALE}")
  set(properties TIMEOUT ${timeout})
  if(ARG_NO_LEAK_CHECK AND DELVIX_SANITIZE STREQUAL "address")
    # Address checking stays; only the leak check at exit is off (the caller says why).
    list(APPEND properties ENVIRONMENT_MODIFICATION "ASAN_OPTIONS=string_append::detect_leaks=0")
  endif()
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST DISCOVERY_TIMEOUT ${discovery} PROPERTIES ${properties})
endfunction()

# delvix_bench(NAME SOURCES ... [LIBS ...]) builds a Google Benchmark executable (not a CTest test:
# speed is measured by `./run bench`, never asserted by timed tests).
function(delvix_bench name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_link_libraries(${name} PRIVATE benchmark::benchmark ${ARG_LIBS})
  target_compile_options(${name} PRIVATE ${DELVIX_WARNINGS})
endfunction()
