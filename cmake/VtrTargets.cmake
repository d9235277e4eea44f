# Helpers that keep the per-folder CMakeLists short.

# vtr_library(NAME DEPS...): a static library of every .cc file in the current
# folder, usable as vtr::NAME. Headers are included as "folder/file.h".
function(vtr_library name)
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cc)
  add_library(vtr_${name} STATIC ${sources})
  add_library(vtr::${name} ALIAS vtr_${name})
  target_include_directories(vtr_${name} PUBLIC ${PROJECT_SOURCE_DIR})
  target_link_libraries(vtr_${name} PUBLIC ${ARGN})
endfunction()

# vtr_test(FOLDER DEPS...): one GoogleTest executable of every .cc file in
# tests/FOLDER, registered with CTest test by test.
function(vtr_test folder)
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/${folder}/*.cc)
  if(NOT sources)
    return()
  endif()
  set(target ${folder}_tests)
  add_executable(${target} ${sources})
  set_target_properties(${target} PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/tests)
  target_link_libraries(${target} PRIVATE ${ARGN} GTest::gtest_main GTest::gmock)
  target_compile_definitions(${target} PRIVATE
    VTR_SOURCE_DIR="${PROJECT_SOURCE_DIR}" VTR_BINARY_DIR="${CMAKE_BINARY_DIR}")
  gtest_discover_tests(${target} DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 300)
endfunction()

# vtr_fuzzer(NAME SOURCE DEPS...): a libFuzzer target (clang only), and a CTest
# entry "fuzz.NAME" that runs it for VTR_FUZZ_SECONDS (default 60) seconds
# over its seed corpus in tests/fuzz/corpus/NAME when that exists.
function(vtr_fuzzer name source)
  if(NOT VTR_FUZZ)
    return()
  endif()
  set(target fuzz_${name})
  add_executable(${target} ${source})
  set_target_properties(${target} PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/fuzz)
  target_compile_options(${target} PRIVATE -fsanitize=fuzzer)
  target_link_options(${target} PRIVATE -fsanitize=fuzzer)
  target_link_libraries(${target} PRIVATE ${ARGN})
  if(NOT DEFINED VTR_FUZZ_SECONDS)
    set(VTR_FUZZ_SECONDS 60)
  endif()
  set(corpus ${CMAKE_BINARY_DIR}/fuzz/corpus_${name})
  set(seeds ${PROJECT_SOURCE_DIR}/tests/fuzz/corpus/${name})
  set(seed_arg "")
  if(EXISTS ${seeds})
    set(seed_arg ${seeds})
  endif()
  add_test(NAME fuzz.${name}
    COMMAND ${CMAKE_COMMAND} -E env ASAN_OPTIONS=detect_leaks=1
      sh -c "mkdir -p ${corpus} && exec $<TARGET_FILE:${target}> -max_total_time=${VTR_FUZZ_SECONDS} -rss_limit_mb=2048 -timeout=10 -print_final_stats=1 ${corpus} ${seed_arg}")
  set_tests_properties(fuzz.${name} PROPERTIES LABELS fuzz TIMEOUT 600)
endfunction()
