# Shared settings for every target of the project.

# STOWLY_SANITIZE=thread builds everything under ThreadSanitizer (scripts/test does so with
# clang for the concurrency tests).
set(STOWLY_SANITIZE "" CACHE STRING "Sanitizer to build with (thread, address, ...); empty for none")
if(STOWLY_SANITIZE)
  add_compile_options(-fsanitize=${STOWLY_SANITIZE} -fno-omit-frame-pointer)
  add_link_options(-fsanitize=${STOWLY_SANITIZE})
endif()

function(stowly_target_defaults target)
  target_compile_options(${target} PRIVATE -Wall -Wextra -Werror)
  # clang checks the lock annotations (common/STWThreadSafety.h).
  if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
    target_compile_options(${target} PRIVATE -Wthread-safety)
  endif()
  # GCC 12 at -O3 (the Release builds of bench/run) reports -Wrestrict inside libstdc++'s
  # own string concatenation ("x" + s) where nothing overlaps (GCC bug 105329, fixed in
  # 13). It stays a warning there rather than failing the build.
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU" AND CMAKE_CXX_COMPILER_VERSION VERSION_LESS 13)
    target_compile_options(${target} PRIVATE -Wno-error=restrict)
  endif()
  target_include_directories(${target} PUBLIC ${PROJECT_SOURCE_DIR})
endfunction()

# stowly_add_library(NAME SOURCES... [LIBS ...])
function(stowly_add_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  stowly_target_defaults(${name})
  set_target_properties(${name} PROPERTIES POSITION_INDEPENDENT_CODE ON)
  target_link_libraries(${name} PUBLIC ${ARG_LIBS})
endfunction()

# stowly_add_test(NAME SOURCES... [LIBS ...]): one GoogleTest binary, its cases
# registered with CTest one by one.
function(stowly_add_test name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  stowly_target_defaults(${name})
  target_link_libraries(${name} PRIVATE ${ARG_LIBS} GTest::gtest GTest::gtest_main)
  gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60
                       PROPERTIES TIMEOUT 300)
endfunction()
