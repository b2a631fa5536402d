# One call makes a library or a test program: every source of the calling folder belongs to it.

add_library(cindral_options INTERFACE)
target_compile_options(cindral_options INTERFACE -Wall -Wextra -Wpedantic -Wshadow=local -Wnon-virtual-dtor)
if(CINDRAL_WARNINGS_AS_ERRORS)
  target_compile_options(cindral_options INTERFACE -Werror)
endif()
target_include_directories(cindral_options INTERFACE ${CMAKE_SOURCE_DIR}/src)
if(CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  # Always an error, however warnings are treated. gcc says -Wshadow=local, clang plain -Wshadow.
  # The standard library's stable sorts use what it declares deprecated itself, which clang puts down to the caller.
  target_compile_options(cindral_options INTERFACE -Wthread-safety -Werror=thread-safety -Wshadow
    -Wno-gnu-statement-expression -Wno-gnu-statement-expression-from-macro-expansion
    -Wno-unknown-warning-option -Wno-unused-command-line-argument -Wno-deprecated-declarations)
endif()
if(CINDRAL_SANITIZE)
  target_compile_options(cindral_options INTERFACE -fsanitize=${CINDRAL_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  target_link_options(cindral_options INTERFACE -fsanitize=${CINDRAL_SANITIZE})
  if(CMAKE_CXX_COMPILER_ID STREQUAL GNU)
    # What the sanitizers insert hides from g++ that a value is set, as its manual says; the builds without them look.
    target_compile_options(cindral_options INTERFACE -Wno-maybe-uninitialized)
  endif()
endif()
if(CINDRAL_FUZZ)
  # The libraries are what is explored, so they are instrumented, not the target's own few lines alone.
  target_compile_options(cindral_options INTERFACE -fsanitize=fuzzer-no-link)
endif()
target_link_libraries(cindral_options INTERFACE fmt::fmt Threads::Threads)

# cindral_library(NAME [DEPENDS library...])
function(cindral_library name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "DEPENDS")
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  if(NOT sources) # Headers alone are a library that can be depended on, too.
    add_library(${name} INTERFACE)
    target_link_libraries(${name} INTERFACE cindral_options ${arg_DEPENDS})
    return()
  endif()
  add_library(${name} STATIC ${sources})
  target_link_libraries(${name} PUBLIC cindral_options ${arg_DEPENDS})
endfunction()

# What tests are compiled with: they are built more often than they are run, so they are optimized less. gcc says by the
# option that a precompiled header may be told apart by a compiler cache. At -O1 gcc 12 takes short strings to be overrun.
add_library(cindral_test_options INTERFACE)
target_compile_options(cindral_test_options INTERFACE $<$<CONFIG:RelWithDebInfo>:-O1>
  $<$<CXX_COMPILER_ID:GNU>:-fpch-preprocess> $<$<CXX_COMPILER_ID:GNU>:-Wno-array-bounds>
  $<$<CXX_COMPILER_ID:GNU>:-Wno-stringop-overflow>)

# cindral_tests(NAME [DEPENDS library...]): the *Test.cpp of the calling folder as one program, each test known to ctest.
function(cindral_tests name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "DEPENDS")
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*Test.cpp ${CMAKE_CURRENT_SOURCE_DIR}/*Fixture.cpp)
  if(NOT sources)
    message(WARNING "No tests in ${CMAKE_CURRENT_SOURCE_DIR}")
    return()
  endif()
  add_executable(${name} ${sources})
  target_include_directories(${name} PRIVATE ${CMAKE_SOURCE_DIR}/tests)
  target_link_libraries(${name} PRIVATE cindral_test_support cindral_test_options GTest::gtest GTest::gmock ${arg_DEPENDS})
  target_precompile_headers(${name} REUSE_FROM cindral_test_support)
  set_target_properties(${name} PROPERTIES UNITY_BUILD ${CINDRAL_UNITY_BUILD} UNITY_BUILD_BATCH_SIZE 12) # As src/CMakeLists.txt says.
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST NO_PRETTY_VALUES PROPERTIES TIMEOUT 300)
endfunction()

# cindral_fuzz_target(NAME [DEPENDS library...]): NAME.cpp with LLVMFuzzerTestOneInput. Built with libFuzzer when asked;
# in every other build a program that replays the corpus beside it (fuzz/corpus/NAME), as a test.
function(cindral_fuzz_target name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "DEPENDS")
  set(corpus ${CMAKE_CURRENT_SOURCE_DIR}/corpus/${name})
  if(CINDRAL_FUZZ)
    add_executable(${name} ${name}.cpp)
    target_link_options(${name} PRIVATE -fsanitize=fuzzer)
    # What is found goes to the first folder, in the build; the corpus grows only by what somebody puts there.
    # A fixed seed and number of runs: the same build does the same work.
    set(found ${CMAKE_CURRENT_BINARY_DIR}/found/${name})
    file(MAKE_DIRECTORY ${found})
    add_test(NAME ${name}.fuzz COMMAND ${name} -seed=1 -runs=100000 -timeout=25 -rss_limit_mb=2048 -print_final_stats=1
      -artifact_prefix=${found}- ${found} ${corpus})
    set_tests_properties(${name}.fuzz PROPERTIES TIMEOUT 3600)
  else()
    add_executable(${name} ${name}.cpp ${CMAKE_SOURCE_DIR}/tests/fuzz/ReplayMain.cpp)
    add_test(NAME ${name}.corpus COMMAND ${name} ${corpus})
    set_tests_properties(${name}.corpus PROPERTIES TIMEOUT 300)
  endif()
  target_link_libraries(${name} PRIVATE cindral_options ${arg_DEPENDS})
endfunction()
