# Compiler settings shared by every target of the project.
add_library(cvdb_options INTERFACE)
target_compile_options(cvdb_options INTERFACE -Wall -Wextra -Wpedantic -Wshadow
  -Wnon-virtual-dtor -Wold-style-cast -Wcast-align -Woverloaded-virtual
  -Wimplicit-fallthrough)
if(CVDB_WERROR)
  target_compile_options(cvdb_options INTERFACE -Werror)
endif()
# The lock annotations of framework/thread_annotations.h; GCC has no such
# analysis and ignores them.
if(CVDB_THREAD_SAFETY AND CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  target_compile_options(cvdb_options INTERFACE -Wthread-safety -Werror=thread-safety)
endif()
# clang before 15 on libstdc++ 12 has no std::source_location; the project
# supplies it there (framework/source_location_compat.h).
if(CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  include(CheckCXXSourceCompiles)
  check_cxx_source_compiles([[
#include <source_location>
int main() { return static_cast<int>(std::source_location::current().line()) > 0 ? 0 : 1; }
]] CVDB_HAVE_SOURCE_LOCATION)
  if(NOT CVDB_HAVE_SOURCE_LOCATION)
    target_compile_options(cvdb_options INTERFACE
      "$<$<COMPILE_LANGUAGE:CXX>:SHELL:-include ${PROJECT_SOURCE_DIR}/src/framework/source_location_compat.h>")
  endif()
endif()
target_compile_definitions(cvdb_options INTERFACE
  CVDB_VERSION="${PROJECT_VERSION}" BOOST_ASIO_NO_DEPRECATED)
if(CVDB_SANITIZE STREQUAL "thread")
  # GCC warns that ThreadSanitizer does not model the fences of Asio's
  # handler invocation (std_fenced_block); Asio hands handlers between
  # threads under its own mutexes, which it does model.
  target_compile_options(cvdb_options INTERFACE -fsanitize=thread
    -fno-omit-frame-pointer $<$<CXX_COMPILER_ID:GNU>:-Wno-tsan>)
  target_link_options(cvdb_options INTERFACE -fsanitize=thread)
elseif(CVDB_SANITIZE MATCHES "^(address|ON|on|TRUE|true|1)$")
  target_compile_options(cvdb_options INTERFACE -fsanitize=address,undefined
    -fno-omit-frame-pointer -fno-sanitize-recover=undefined)
  target_link_options(cvdb_options INTERFACE -fsanitize=address,undefined)
elseif(CVDB_SANITIZE)
  message(FATAL_ERROR "CVDB_SANITIZE must be OFF, address or thread, not ${CVDB_SANITIZE}")
endif()

# cvdb_add_test(<name> SOURCES ... LIBS ...): one GoogleTest executable,
# registered with CTest test by test.
function(cvdb_add_test name)
  cmake_parse_arguments(T "" "TIMEOUT" "SOURCES;LIBS;LABELS" ${ARGN})
  add_executable(${name} ${T_SOURCES})
  target_link_libraries(${name} PRIVATE ${T_LIBS} cvdb_testing GTest::gtest GTest::gmock cvdb_options)
  if(NOT T_TIMEOUT)
    set(T_TIMEOUT 300)
  endif()
  if(CVDB_SANITIZE STREQUAL "thread")
    # ThreadSanitizer runs the code five to fifteen times slower.
    math(EXPR T_TIMEOUT "${T_TIMEOUT} * 2")
  endif()
  gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60
    PROPERTIES TIMEOUT ${T_TIMEOUT} LABELS "${T_LABELS}")
endfunction()
