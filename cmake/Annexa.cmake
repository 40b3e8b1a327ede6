# Build conventions shared by every component.

set(AX_WARNINGS -Wall -Wextra -Wpedantic -Wnon-virtual-dtor -Wcast-align -Wunused
    -Woverloaded-virtual -Wformat=2 -Wimplicit-fallthrough)
if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
  list(APPEND AX_WARNINGS -Wshadow -Wno-gnu-zero-variadic-macro-arguments)
  if(AX_THREAD_SAFETY)
    list(APPEND AX_WARNINGS -Wthread-safety -Werror=thread-safety)
  endif()
else()
  # g++'s plain -Wshadow also flags enumerators that share a name with a type (Value::Kind::Array
  # and corvane::Array); local shadowing is what catches real mistakes.
  list(APPEND AX_WARNINGS -Wshadow=local)
endif()

if(AX_SANITIZE)
  add_compile_options(-fsanitize=address,undefined -fno-omit-frame-pointer -fno-sanitize-recover=undefined)
  add_link_options(-fsanitize=address,undefined)
endif()
if(AX_FUZZ)
  # Every library is instrumented for coverage; only fuzz targets link libFuzzer's main.
  add_compile_options(-fsanitize=fuzzer-no-link)
endif()

# ax_library(NAME SOURCES ... [PUBLIC libs...] [PRIVATE libs...])
# A component library. Its public header lives beside the sources and is included as
# "<folder>/<Header>.h" from the repository root.
function(ax_library name)
  cmake_parse_arguments(AX "" "" "SOURCES;PUBLIC;PRIVATE" ${ARGN})
  add_library(${name} STATIC ${AX_SOURCES})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
  target_compile_options(${name} PRIVATE ${AX_WARNINGS})
  target_link_libraries(${name} PUBLIC ${AX_PUBLIC} PRIVATE ${AX_PRIVATE})
endfunction()

# ax_executable(NAME SOURCES ... LIBS ...)
function(ax_executable name)
  cmake_parse_arguments(AX "" "" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${AX_SOURCES})
  target_compile_options(${name} PRIVATE ${AX_WARNINGS})
  target_link_libraries(${name} PRIVATE ${AX_LIBS})
endfunction()

# ax_add_test(NAME SOURCES ... LIBS ...)
# A GoogleTest program; each test case becomes its own CTest entry.
function(ax_add_test name)
  cmake_parse_arguments(AX "" "" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${AX_SOURCES})
  target_compile_options(${name} PRIVATE ${AX_WARNINGS})
  target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR})
  target_link_libraries(${name} PRIVATE ${AX_LIBS} ax_testsupport GTest::gtest_main GTest::gmock)
  if(NOT AX_TESTS)
    set_target_properties(${name} PROPERTIES EXCLUDE_FROM_ALL TRUE)
    return()
  endif()
  gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60
    PROPERTIES ENVIRONMENT "AX_BUILD_BIN=${CMAKE_BINARY_DIR}/bin;AX_SOURCE_DIR=${PROJECT_SOURCE_DIR}")
endfunction()

# ax_add_fuzzer(NAME SOURCES ... LIBS ...)
# With AX_FUZZ a libFuzzer binary plus a CTest entry that fuzzes for AX_FUZZ_SECONDS; without it a
# plain program that replays the seed corpus (fuzz/corpus/NAME), so the target always builds and
# its seeds run in every build.
set(AX_FUZZ_SECONDS 5 CACHE STRING "Seconds each fuzz target runs in the test suite")
function(ax_add_fuzzer name)
  cmake_parse_arguments(AX "" "" "SOURCES;LIBS" ${ARGN})
  set(corpus ${PROJECT_SOURCE_DIR}/fuzz/corpus/${name})
  if(AX_FUZZ)
    add_executable(${name} ${AX_SOURCES})
    target_link_options(${name} PRIVATE -fsanitize=fuzzer)
    set(workdir ${CMAKE_BINARY_DIR}/fuzz-work/${name})
    file(MAKE_DIRECTORY ${workdir})
    add_test(NAME fuzz.${name}
      COMMAND ${name} -max_total_time=${AX_FUZZ_SECONDS} -rss_limit_mb=2048 -timeout=10
              ${workdir} ${corpus})
  else()
    add_executable(${name} ${AX_SOURCES} ${PROJECT_SOURCE_DIR}/fuzz/replay_main.cpp)
    add_test(NAME fuzz.${name}.seeds COMMAND ${name} ${corpus})
  endif()
  target_compile_options(${name} PRIVATE ${AX_WARNINGS})
  target_link_libraries(${name} PRIVATE ${AX_LIBS})
  if(NOT AX_TESTS)
    set_target_properties(${name} PROPERTIES EXCLUDE_FROM_ALL TRUE)
  endif()
endfunction()
