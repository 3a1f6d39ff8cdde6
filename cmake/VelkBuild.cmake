# Compiler settings, dependencies, and the two functions that every folder uses.

include(CheckCXXCompilerFlag)
find_package(PkgConfig REQUIRED)
find_package(Threads REQUIRED)

add_compile_options(-Wall -Wextra -Werror $<$<COMPILE_LANG_AND_ID:CXX,GNU>:-Wshadow=compatible-local> $<$<COMPILE_LANGUAGE:CXX>:-Wnon-virtual-dtor> $<$<COMPILE_LANGUAGE:CXX>:-Woverloaded-virtual>
                    $<$<COMPILE_LANGUAGE:CXX>:-Wno-missing-field-initializers>)
if(CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  add_compile_options(-Wthread-safety -Wno-error=unused-command-line-argument)
  add_compile_options(-Wno-shadow)
endif()
# gcc 12 sees overlapping copies and uninitialised variants where optimised code has none.
add_compile_options("$<$<AND:$<CONFIG:Release>,$<COMPILE_LANG_AND_ID:CXX,GNU>>:-Wno-restrict;-Wno-maybe-uninitialized>")
if(VELK_SANITIZE STREQUAL "asan")
  # Instrumented variants look uninitialised to gcc 12.
  add_compile_options($<$<COMPILE_LANG_AND_ID:CXX,GNU>:-Wno-maybe-uninitialized>)
  add_compile_options(-fsanitize=address,undefined -fno-sanitize-recover=undefined -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
elseif(VELK_SANITIZE STREQUAL "tsan")
  add_compile_options(-fsanitize=thread -fno-omit-frame-pointer)
  # gcc's sanitizer does not model standalone fences; the code uses none, headers of Asio do.
  add_compile_options($<$<COMPILE_LANG_AND_ID:CXX,GNU>:-Wno-tsan> $<$<COMPILE_LANG_AND_ID:CXX,GNU>:-Wno-maybe-uninitialized>)
  add_link_options(-fsanitize=thread)
endif()

# Functions that nothing in a program calls stay out of what is installed.
add_compile_options($<$<CONFIG:Release>:-ffunction-sections> $<$<CONFIG:Release>:-fdata-sections>)
add_link_options($<$<CONFIG:Release>:-Wl,--gc-sections>)

# What is linked but not used (a library's folder that a program needs half of) stays out of the program.
add_link_options(-Wl,--as-needed)

# Precompiled headers: gcc spends most of a file's time on the standard library's headers. One set for the product, one
# more with GoogleTest for the tests. The linter compiles without them, so that each file still names what it needs.
option(VELK_PRECOMPILE "Use precompiled headers" ON)
if(NOT CMAKE_CXX_COMPILER_ID STREQUAL "GNU" OR CMAKE_BUILD_TYPE STREQUAL "Release")
  set(VELK_PRECOMPILE OFF)
endif()
set(VELK_PRECOMPILED_HEADERS <algorithm> <array> <atomic> <chrono> <cstdint> <deque> <functional> <map> <memory>
    <optional> <ranges> <span> <string> <string_view> <unordered_map> <utility> <variant> <vector>)
# A target that compiles the headers once, for others of its kind: velk_precompile(name LIBRARY|PROGRAM HEADER ...)
# gcc takes no header that was compiled for a library into a program's file, nor the other way round.
function(velk_precompile name kind)
  if(VELK_PRECOMPILE)
    file(CONFIGURE OUTPUT ${CMAKE_BINARY_DIR}/${name}.cpp CONTENT "int main() {}\n")
    if(kind STREQUAL "PROGRAM")
      add_executable(${name} ${CMAKE_BINARY_DIR}/${name}.cpp)
    else()
      add_library(${name} OBJECT ${CMAKE_BINARY_DIR}/${name}.cpp)
    endif()
    # ccache wants it.
    target_compile_options(${name} PRIVATE -fpch-preprocess)
    target_precompile_headers(${name} PRIVATE ${ARGN})
  endif()
endfunction()
function(velk_use_precompiled target name)
  if(VELK_PRECOMPILE)
    target_compile_options(${target} PRIVATE $<$<COMPILE_LANGUAGE:CXX>:-fpch-preprocess>)
    target_precompile_headers(${target} REUSE_FROM ${name})
  endif()
endfunction()
velk_precompile(velk_precompiled LIBRARY ${VELK_PRECOMPILED_HEADERS})

# The current folder (and its linux/ half) as a static library:
# velk_library(name [EXCLUDE main.cpp] LINKS ... [COMPACT [FAST ...] [SMALL ...]])
# COMPACT is for what every process that reports has in its memory: a release has it at -O2, what each event passes
# (FAST) at -O3, and what runs once a session or less (SMALL) at -Os.
function(velk_library name)
  cmake_parse_arguments(ARG "COMPACT" "" "EXCLUDE;LINKS;PRIVATE_LINKS;FAST;SMALL" ${ARGN})
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp ${CMAKE_CURRENT_SOURCE_DIR}/linux/*.cpp)
  foreach(excluded ${ARG_EXCLUDE})
    list(REMOVE_ITEM sources ${CMAKE_CURRENT_SOURCE_DIR}/${excluded})
  endforeach()
  if(NOT sources)
    file(WRITE ${CMAKE_CURRENT_BINARY_DIR}/empty.cpp "")
    set(sources ${CMAKE_CURRENT_BINARY_DIR}/empty.cpp)
  endif()
  add_library(velk_${name} STATIC ${sources})
  target_include_directories(velk_${name} PUBLIC ${CMAKE_SOURCE_DIR})
  target_link_libraries(velk_${name} PUBLIC ${ARG_LINKS} PRIVATE ${ARG_PRIVATE_LINKS})
  velk_use_precompiled(velk_${name} velk_precompiled)
  if(ARG_COMPACT)
    target_compile_options(velk_${name} PRIVATE $<$<CONFIG:Release>:-O2>)
    set_property(SOURCE ${ARG_FAST} APPEND PROPERTY COMPILE_OPTIONS $<$<CONFIG:Release>:-O3>)
    set_property(SOURCE ${ARG_SMALL} APPEND PROPERTY COMPILE_OPTIONS $<$<CONFIG:Release>:-Os>)
  endif()
endfunction()

# A test program with one ctest entry: velk_test(name SOURCES ... LINKS ... [TIMEOUT seconds])
# Under a sanitizer it has three times as long.
function(velk_test name)
  cmake_parse_arguments(ARG "" "TIMEOUT" "SOURCES;LINKS" ${ARGN})
  if(NOT ARG_SOURCES)
    return()
  endif()
  if(NOT ARG_TIMEOUT)
    set(ARG_TIMEOUT 120)
  endif()
  if(VELK_SANITIZE)
    math(EXPR ARG_TIMEOUT "3 * ${ARG_TIMEOUT}")
  endif()
  add_executable(${name} ${ARG_SOURCES})
  target_link_libraries(${name} PRIVATE ${ARG_LINKS} velk_test_support GTest::gtest GTest::gmock GTest::gtest_main)
  # Two thirds of a test file's compilation would go into optimising assertions.
  target_compile_options(${name} PRIVATE -O0)
  velk_use_precompiled(${name} velk_precompiled_tests)
  if(VELK_SANITIZE STREQUAL "tsan")
    # The sanitizer's shadow needs an address space laid out without randomisation.
    add_test(NAME ${name} COMMAND setarch -R $<TARGET_FILE:${name}>)
  else()
    add_test(NAME ${name} COMMAND ${name})
  endif()
  set_tests_properties(${name} PROPERTIES TIMEOUT ${ARG_TIMEOUT})
endfunction()
