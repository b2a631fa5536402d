# One call makes a library or a test program: every source of the calling folder belongs to it.

add_library(cindral_options INTERFACE)
target_compile_options(cindral_options INTERFACE -Wall -Wextra -Wpedantic -Wno-gnu-statement-expression
  -Wno-gnu-statement-expression-from-macro-expansion -Wshadow=local -Wnon-virtual-dtor -Werror)
target_include_directories(cindral_options INTERFACE ${CMAKE_SOURCE_DIR}/src)
if(CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  target_compile_options(cindral_options INTERFACE -Wthread-safety -Wno-unknown-warning-option -Wno-unused-command-line-argument)
  # gcc says -Wshadow=local, clang plain -Wshadow.
  target_compile_options(cindral_options INTERFACE -Wshadow)
endif()
if(CINDRAL_SANITIZE)
  target_compile_options(cindral_options INTERFACE -fsanitize=${CINDRAL_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  target_link_options(cindral_options INTERFACE -fsanitize=${CINDRAL_SANITIZE})
endif()
target_link_libraries(cindral_options INTERFACE fmt::fmt Threads::Threads)

# cindral_library(NAME [DEPENDS library...])
function(cindral_library name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "DEPENDS")
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  if(NOT sources)
    return()
  endif()
  add_library(${name} STATIC ${sources})
  target_link_libraries(${name} PUBLIC cindral_options ${arg_DEPENDS})
endfunction()

# cindral_tests(NAME [DEPENDS library...]): the *Test.cpp of the calling folder as one program, each test known to ctest.
function(cindral_tests name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "DEPENDS")
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*Test.cpp)
  add_executable(${name} ${sources})
  target_include_directories(${name} PRIVATE ${CMAKE_SOURCE_DIR}/tests)
  target_link_libraries(${name} PRIVATE cindral_test_support GTest::gtest GTest::gmock ${arg_DEPENDS})
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST PROPERTIES TIMEOUT 300)
endfunction()

# cindral_fuzz_target(NAME [DEPENDS library...]): NAME.cpp with LLVMFuzzerTestOneInput. Built with libFuzzer when asked;
# in every other build a program that replays the corpus beside it (fuzz/corpus/NAME), as a test.
function(cindral_fuzz_target name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "DEPENDS")
  if(CINDRAL_FUZZ)
    add_executable(${name} ${name}.cpp)
    target_compile_options(${name} PRIVATE -fsanitize=fuzzer)
    target_link_options(${name} PRIVATE -fsanitize=fuzzer)
  else()
    add_executable(${name} ${name}.cpp ${CMAKE_SOURCE_DIR}/tests/fuzz/ReplayMain.cpp)
    add_test(NAME ${name}.corpus COMMAND ${name} ${CMAKE_CURRENT_SOURCE_DIR}/corpus/${name})
  endif()
  target_link_libraries(${name} PRIVATE cindral_options ${arg_DEPENDS})
endfunction()
