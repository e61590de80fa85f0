# Shared settings for every target of the project.

function(stowly_target_defaults target)
  target_compile_options(${target} PRIVATE -Wall -Wextra -Werror)
  # g++ 12 at -O3 (Release, as bench/run builds) reports a false -Wrestrict inside
  # libstdc++ for `"." + std::string` (GCC bug 105651); keep it a warning, not a failure.
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    target_compile_options(${target} PRIVATE $<$<COMPILE_LANGUAGE:CXX>:-Wno-error=restrict>)
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
