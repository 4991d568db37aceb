# What every target of this project has in common: the language, the warnings, the sanitizers, and where programs land.

set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_C_STANDARD 11)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
include(CheckPIESupported)
check_pie_supported()  # programs are linked as such too, whatever the compiler's own default
set(CMAKE_RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)
set(CMAKE_LIBRARY_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/lib)

set(CMAKE_CXX_FLAGS_DEV "-O1 -g1")
set(CMAKE_C_FLAGS_DEV "-O1 -g1")
set(CMAKE_CXX_FLAGS_RELEASE "-O2 -g1 -DNDEBUG -ffunction-sections -fdata-sections")
set(CMAKE_C_FLAGS_RELEASE "-O2 -g1 -DNDEBUG")

set(THREADS_PREFER_PTHREAD_FLAG ON)
find_package(Threads REQUIRED)

add_library(kyt_options INTERFACE)
target_include_directories(kyt_options INTERFACE ${CMAKE_SOURCE_DIR})
target_link_libraries(kyt_options INTERFACE Threads::Threads)
# Where a long has 32 bits: sizes of files, limits and times of 64 all the same.
if(CMAKE_SIZEOF_VOID_P EQUAL 4)
  target_compile_definitions(kyt_options INTERFACE _FILE_OFFSET_BITS=64 _TIME_BITS=64)
endif()
target_compile_options(kyt_options INTERFACE
  -Wall -Wextra -Wpedantic -Werror -Wshadow -Wformat=2 -fno-omit-frame-pointer
  $<$<COMPILE_LANGUAGE:CXX>:-Wnon-virtual-dtor -Wunused-result>
  $<$<AND:$<COMPILE_LANGUAGE:CXX>,$<CXX_COMPILER_ID:Clang>>:-Wthread-safety -Wno-gnu-zero-variadic-macro-arguments>)
if(CMAKE_BUILD_TYPE STREQUAL "Release")
  target_compile_options(kyt_options INTERFACE -fstack-protector-strong -D_FORTIFY_SOURCE=2)
endif()

# Optimisation at link time is for the daemon, the client library and the benchmarks alone, since each program that has it
# makes the machine code of all libraries anew. So their objects hold both kinds, and other programs are linked from the
# machine code, with -fno-lto. A folder whose own objects no such program needs says set(KYT_LINK_TIME_OPTIMIZATION OFF).
#
# The archives' index must name what the machine code defines. With its plug-in ar lists the other kind's names, among
# them inline functions of which no machine code is left; the linker then takes a member twice that it had already.
# An explicit target keeps the plug-in out.
define_property(TARGET PROPERTY KYT_LINK_TIME_OPTIMIZATION INITIALIZE_FROM_VARIABLE KYT_LINK_TIME_OPTIMIZATION)
if(KYT_LINK_TIME_OPTIMIZATION)
  if(NOT CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    message(FATAL_ERROR "KYT_LINK_TIME_OPTIMIZATION needs GCC")
  endif()
  set(wanted $<BOOL:$<TARGET_PROPERTY:KYT_LINK_TIME_OPTIMIZATION>>)
  target_compile_options(kyt_options INTERFACE "$<${wanted}:-flto=auto;-ffat-lto-objects>")
  target_link_options(kyt_options INTERFACE "$<${wanted}:-flto=auto>" "$<$<NOT:${wanted}>:-fno-lto;-Wl,--gc-sections>")
  execute_process(COMMAND ${CMAKE_LINKER} --print-output-format OUTPUT_VARIABLE format OUTPUT_STRIP_TRAILING_WHITESPACE
    COMMAND_ERROR_IS_FATAL ANY)
  set(CMAKE_CXX_ARCHIVE_CREATE "<CMAKE_AR> --target=${format} qcs <TARGET> <LINK_FLAGS> <OBJECTS>")
  set(CMAKE_CXX_ARCHIVE_APPEND "<CMAKE_AR> --target=${format} qs <TARGET> <LINK_FLAGS> <OBJECTS>")
  set(CMAKE_CXX_ARCHIVE_FINISH "")
endif()

if(KYT_SANITIZER)
  target_compile_options(kyt_options INTERFACE -fsanitize=${KYT_SANITIZER} -fno-sanitize-recover=all)
  target_link_options(kyt_options INTERFACE -fsanitize=${KYT_SANITIZER})
  if(KYT_SANITIZER MATCHES "undefined")
    # The dynamic-type check probes memory through a pipe, and so reports objects as invalid in the tests that run out of
    # descriptors on purpose.
    target_compile_options(kyt_options INTERFACE -fno-sanitize=vptr)
  endif()
  if(KYT_FUZZ)
    target_compile_options(kyt_options INTERFACE -fsanitize=fuzzer-no-link)
    target_link_options(kyt_options INTERFACE -fsanitize=fuzzer-no-link)
  endif()
endif()
if(KYT_COVERAGE)
  target_compile_options(kyt_options INTERFACE --coverage)
  target_link_options(kyt_options INTERFACE --coverage)
endif()

# kyt_precompiled_headers(NAME HEADERS ... [LINKS ...] [OPTIONS ...]): headers that are compiled once for all targets that
# reuse them from NAME. No header of this project is among them, so a change of one never compiles them anew.
function(kyt_precompiled_headers name)
  cmake_parse_arguments(ARG "" "" "HEADERS;LINKS;OPTIONS" ${ARGN})
  file(CONFIGURE OUTPUT ${CMAKE_BINARY_DIR}/${name}.cpp CONTENT "")
  add_library(${name} OBJECT ${CMAKE_BINARY_DIR}/${name}.cpp)
  target_link_libraries(${name} PRIVATE kyt_options ${ARG_LINKS})
  target_compile_options(${name} PRIVATE ${ARG_OPTIONS})
  if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")  # the compiler cache finds again what holds no time
    target_compile_options(${name} PRIVATE "SHELL:-Xclang -fno-pch-timestamp")
  endif()
  target_precompile_headers(${name} PRIVATE ${ARG_HEADERS})
endfunction()

# kyt_library(NAME SOURCES ... LINKS ...): one folder's static library. In a build with optimisation at link time, which is
# made whole more often than changed, the standard library's headers are compiled once; in the others, and in packages,
# each file shows what it forgot to include.
function(kyt_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LINKS;PRIVATE_LINKS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_link_libraries(${name} PUBLIC kyt_options ${ARG_LINKS} PRIVATE ${ARG_PRIVATE_LINKS})
  if(KYT_LINK_TIME_OPTIMIZATION AND KYT_PRECOMPILED_HEADERS)
    if(NOT TARGET kyt_headers)
      kyt_precompiled_headers(kyt_headers HEADERS <algorithm> <array> <atomic> <chrono> <condition_variable> <functional>
        <map> <memory> <mutex> <optional> <string> <string_view> <thread> <unordered_map> <utility> <variant> <vector>)
    endif()
    target_precompile_headers(${name} REUSE_FROM kyt_headers)
  endif()
endfunction()

# What tests are compiled with: without optimisation, for nothing measures them, and with the headers of the test
# framework and of the standard library compiled once.
function(kyt_test_options name)
  target_compile_options(${name} PRIVATE -O0 -U_FORTIFY_SOURCE)
  if(NOT KYT_PRECOMPILED_HEADERS)
    return()
  endif()
  if(NOT TARGET kyt_tests_headers)
    kyt_precompiled_headers(kyt_tests_headers LINKS GTest::gtest
      OPTIONS -O0 -U_FORTIFY_SOURCE -fPIE  # as programs are compiled
      HEADERS <gtest/gtest.h> <algorithm> <array> <atomic> <chrono> <condition_variable> <filesystem> <fstream>
        <functional> <future> <map> <memory> <mutex> <optional> <set> <sstream> <string> <string_view> <thread>
        <unordered_map> <utility> <variant> <vector>)
  endif()
  target_precompile_headers(${name} REUSE_FROM kyt_tests_headers)
endfunction()

# kyt_test(NAME SOURCES ... LINKS ... [TIMEOUT SECONDS] [FIRST]): one test program; its tests appear one by one in ctest.
# Those that take long come FIRST, so that others run beside them.
function(kyt_test name)
  cmake_parse_arguments(ARG "SERIAL;FIRST" "TIMEOUT" "SOURCES;LINKS;LABELS" ${ARGN})
  if(NOT ARG_TIMEOUT)
    set(ARG_TIMEOUT 60)
  endif()
  add_executable(${name} ${ARG_SOURCES})
  target_link_libraries(${name} PRIVATE kyt_options ${ARG_LINKS} GTest::gtest_main)
  kyt_test_options(${name})
  set_property(GLOBAL APPEND PROPERTY KYT_TEST_SOURCES ${ARG_SOURCES})
  set(properties TIMEOUT ${ARG_TIMEOUT})
  if(ARG_LABELS)
    list(APPEND properties LABELS "${ARG_LABELS}")
  endif()
  if(ARG_SERIAL)
    list(APPEND properties RUN_SERIAL ON)
  endif()
  if(ARG_FIRST)
    list(APPEND properties COST 1000)
  endif()
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST DISCOVERY_TIMEOUT 60 PROPERTIES ${properties})
endfunction()

# kyt_folder(NAME [LINKS ...] [PRIVATE_LINKS ...]): the library made of all .cpp files of the current folder. A folder
# that has none yet is an interface target, so that others can name it.
function(kyt_folder name)
  cmake_parse_arguments(ARG "" "" "LINKS;PRIVATE_LINKS;SOURCES" ${ARGN})
  if(ARG_SOURCES)
    set(sources ${ARG_SOURCES})
  else()
    file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  endif()
  if(sources)
    kyt_library(${name} SOURCES ${sources} LINKS ${ARG_LINKS} PRIVATE_LINKS ${ARG_PRIVATE_LINKS})
  else()
    add_library(${name} INTERFACE)
    target_link_libraries(${name} INTERFACE kyt_options ${ARG_LINKS})
  endif()
endfunction()

# kyt_test_folder(NAME LINKS ...): one test program made of all *_test.cpp files of the current folder.
function(kyt_test_folder name)
  cmake_parse_arguments(ARG "SERIAL;FIRST" "TIMEOUT" "LINKS;LABELS" ${ARGN})
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*_test.cpp)
  if(sources)
    set(flags)
    if(ARG_SERIAL)
      list(APPEND flags SERIAL)
    endif()
    if(ARG_FIRST)
      list(APPEND flags FIRST)
    endif()
    kyt_test(${name} SOURCES ${sources} LINKS ${ARG_LINKS} LABELS "${ARG_LABELS}" TIMEOUT "${ARG_TIMEOUT}" ${flags})
  endif()
endfunction()
