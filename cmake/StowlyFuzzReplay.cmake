# Builds the fuzz targets with clang (libFuzzer needs it, whatever compiler builds the
# rest) and has CTest replay their seed corpora under ASan and UBSan, so that every test
# run also proves each committed seed still goes through without a finding. The clang
# build lives in fuzz-clang/ inside this build directory and only builds what the fuzz
# targets need; scripts/fuzz is for fuzzing itself.

option(STOWLY_FUZZ_REPLAY "Build the fuzz targets with clang and replay their seed corpora in CTest" ON)
if(NOT STOWLY_FUZZ_REPLAY OR STOWLY_BUILD_FUZZ)
  # A clang build with STOWLY_BUILD_FUZZ registers the replays itself (fuzz/CMakeLists.txt).
  return()
endif()

find_program(STOWLY_FUZZ_C_COMPILER NAMES clang clang-14)
find_program(STOWLY_FUZZ_CXX_COMPILER NAMES clang++ clang++-14)
if(NOT STOWLY_FUZZ_C_COMPILER OR NOT STOWLY_FUZZ_CXX_COMPILER)
  message(WARNING "clang is not installed (scripts/setup installs it): the fuzz targets are not "
                  "built and their seed corpora are not replayed")
  return()
endif()

include(ExternalProject)
set(fuzz_build ${PROJECT_BINARY_DIR}/fuzz-clang)
ExternalProject_Add(stowly_fuzz_targets
  SOURCE_DIR ${PROJECT_SOURCE_DIR}
  BINARY_DIR ${fuzz_build}
  CMAKE_ARGS
    -DCMAKE_C_COMPILER=${STOWLY_FUZZ_C_COMPILER}
    -DCMAKE_CXX_COMPILER=${STOWLY_FUZZ_CXX_COMPILER}
    -DCMAKE_BUILD_TYPE=RelWithDebInfo
    -DSTOWLY_BUILD_FUZZ=ON
    -DSTOWLY_BUILD_TESTS=OFF
    -DSTOWLY_BUILD_BENCH=OFF
  BUILD_COMMAND ${CMAKE_COMMAND} --build ${fuzz_build} --target stowly_fuzzers
  INSTALL_COMMAND ""
  # The sources are this project's own: let the inner build decide what changed.
  BUILD_ALWAYS ON)

file(GLOB corpora RELATIVE ${PROJECT_SOURCE_DIR}/fuzz ${PROJECT_SOURCE_DIR}/fuzz/*/corpus)
foreach(corpus ${corpora})
  get_filename_component(name ${corpus} DIRECTORY)
  # -runs=0: run every seed once and stop; any crash, leak or sanitizer report fails.
  add_test(NAME fuzz_${name}_corpus_replay
           COMMAND ${fuzz_build}/fuzz/${name}/stowly_${name}_fuzzer -runs=0
                   ${PROJECT_SOURCE_DIR}/fuzz/${name}/corpus)
  # A private root that a crash leaves behind stays in the build directory, not in /tmp.
  set_tests_properties(fuzz_${name}_corpus_replay PROPERTIES ENVIRONMENT TMPDIR=${fuzz_build}/fuzz/${name})
endforeach()
