# SPDX-License-Identifier: Apache-2.0
# The three kinds of target this project has, each with the same warnings and language level.
set(CMAKE_CXX_STANDARD 23)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)

add_library(zor_options INTERFACE)
target_compile_options(zor_options INTERFACE
    -Wall -Wextra -Wpedantic -Wnon-virtual-dtor -Woverloaded-virtual -Wformat=2 -Wundef
    -fno-omit-frame-pointer -fstack-protector-strong
    # One of several sources compiled together may hide a name that only another has; lint judges each with this warning.
    $<$<NOT:$<BOOL:$<TARGET_PROPERTY:UNITY_BUILD>>>:-Wshadow>
    # TRY is a statement expression; both compilers have them, and no standard form can return from the caller. This clang
    # finds a use of something deprecated inside this library's own stable_sort; gcc still says where ours do.
    $<$<CXX_COMPILER_ID:Clang>:-Wthread-safety -Wno-missing-designated-field-initializers
        -Wno-gnu-statement-expression-from-macro-expansion -Wno-deprecated-declarations>
    # An aggregate's members carry their own defaults; naming only some of them at a call is how this project writes options.
    $<$<CXX_COMPILER_ID:GNU>:-Wno-missing-field-initializers>
    # At -O2 gcc 12 takes the inactive members of a variant for ones that are read; the other builds keep the warning.
    $<$<AND:$<CXX_COMPILER_ID:GNU>,$<NOT:$<CONFIG:Debug>>>:-Wno-maybe-uninitialized>
    $<$<CONFIG:Release>:-D_FORTIFY_SOURCE=2>)
# The standard library's own checks (an index out of range, an empty optional) stay on in every build.
target_compile_definitions(zor_options INTERFACE _GNU_SOURCE _FILE_OFFSET_BITS=64 _GLIBCXX_ASSERTIONS
    ZORVANE_VERSION="${PROJECT_VERSION}")
target_include_directories(zor_options INTERFACE ${CMAKE_SOURCE_DIR}/src)
# Position-independent code everywhere, in one way, so that all targets can share one precompiled header.
set(CMAKE_POSITION_INDEPENDENT_CODE OFF)
target_compile_options(zor_options INTERFACE -fPIC)

# The headers of libraries take half of the time that a translation unit takes without this. tools/house.py looks whether
# sources include those that they use.
# zor_precompile(name LINK ... HEADERS ...): the standard headers and these, for the targets of this folder from here on.
# Lint judges the product's sources as they are, and has the headers of tests precompiled: they are most of a test's text.
set(ZORVANE_PCH all CACHE STRING "Which sources have the headers of libraries precompiled: none, tests, all")
macro(zor_precompile name)
    cmake_parse_arguments(ARG "" "" "LINK;HEADERS" ${ARGN})
    if(ZORVANE_PCH STREQUAL all)
        file(CONFIGURE OUTPUT ${CMAKE_BINARY_DIR}/pch.cc CONTENT "")
        add_library(${name} STATIC ${CMAKE_BINARY_DIR}/pch.cc)
        target_link_libraries(${name} PRIVATE zor_options ${ARG_LINK})
        target_precompile_headers(${name} PRIVATE <algorithm> <atomic> <condition_variable> <deque> <expected> <functional>
            <map> <memory> <mutex> <optional> <set> <span> <string> <string_view> <thread> <unordered_set> <variant>
            <vector> ${ARG_HEADERS})
        set(ZORVANE_PRECOMPILED ${name})
    endif()
endmacro()
function(zor_use_pch target)
    if(ZORVANE_PRECOMPILED)
        target_precompile_headers(${target} REUSE_FROM ${ZORVANE_PRECOMPILED})
    endif()
endfunction()
zor_precompile(zor_pch)

# Sources that are compiled several at once take half the time. By default tests are, and the tool, whose libraries are all
# headers; the rest of the product is where its tree is mostly built from nothing: under sanitizers and fuzzers. The other trees
# compile each of its sources by itself, so that it includes what it needs. Lint wants each source by its own name.
set(ZORVANE_TOGETHER tests CACHE STRING "Which sources are compiled several at once: none, tests, all")
function(zor_compile_together target)
    if(ZORVANE_TOGETHER STREQUAL none)
        return()
    endif()
    set_target_properties(${target} PROPERTIES UNITY_BUILD ON UNITY_BUILD_BATCH_SIZE 8)
    # gcc 12 is wrong about strings that are put together in an expression, as tests do; the clang builds have no such doubt.
    target_compile_options(${target} PRIVATE $<$<CXX_COMPILER_ID:GNU>:-Wno-array-bounds -Wno-restrict
        -Wno-maybe-uninitialized -Wno-stringop-overflow>)
endfunction()

# zor_library(name DIR folders... [EXCLUDE files...] LINK ... [INCLUDE folders...]): the sources of these folders, as zor_<name>.
function(zor_library name)
    cmake_parse_arguments(ARG "" "" "DIR;EXCLUDE;LINK;INCLUDE" ${ARGN})
    set(sources "")
    foreach(dir IN LISTS ARG_DIR)
        file(GLOB found CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/${dir}/*.cc)
        list(APPEND sources ${found})
    endforeach()
    foreach(file IN LISTS ARG_EXCLUDE)
        list(FILTER sources EXCLUDE REGEX "/${file}$")
    endforeach()
    if(NOT sources)
        message(STATUS "${name}: no sources yet")
        add_library(zor_${name} INTERFACE)
        list(REMOVE_ITEM ARG_LINK PUBLIC)
        target_link_libraries(zor_${name} INTERFACE zor_options ${ARG_LINK})
        return()
    endif()
    add_library(zor_${name} STATIC ${sources})
    if(ZORVANE_TOGETHER STREQUAL all)
        zor_compile_together(zor_${name})
    endif()
    zor_use_pch(zor_${name})
    target_link_libraries(zor_${name} PUBLIC zor_options)
    target_link_libraries(zor_${name} ${ARG_LINK})
    foreach(dir IN LISTS ARG_INCLUDE)
        target_include_directories(zor_${name} PUBLIC ${CMAKE_SOURCE_DIR}/${dir})
    endforeach()
endfunction()

# zor_program(name SOURCES files... | DIR folders... LINK ...)
function(zor_program name)
    cmake_parse_arguments(ARG "" "" "DIR;SOURCES;LINK" ${ARGN})
    set(sources ${ARG_SOURCES})
    foreach(dir IN LISTS ARG_DIR)
        file(GLOB found CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/${dir}/*.cc)
        list(APPEND sources ${found})
    endforeach()
    foreach(source IN LISTS ARG_SOURCES)
        if(NOT EXISTS ${CMAKE_SOURCE_DIR}/${source})
            return()
        endif()
    endforeach()
    if(NOT sources)
        return()
    endif()
    add_executable(${name} ${sources})
    if(ZORVANE_TOGETHER STREQUAL all)
        zor_compile_together(${name})
    endif()
    zor_use_pch(${name})
    target_link_libraries(${name} PRIVATE zor_options ${ARG_LINK})
    # A device takes a program with its C++ runtime inside; a distribution, and a sanitizer, have a shared one. A program loads no
    # library of those that it may use (the daemon's XML reader) unless it does.
    target_link_options(${name} PRIVATE -Wl,-z,relro,-z,now,--as-needed
        $<$<BOOL:${ZORVANE_STATIC_RUNTIME}>:-static-libstdc++;-static-libgcc>)
endfunction()

# zor_test(area [DIR dirs...] [COST seconds] [WAITING filter] LINK libs...): every tests/<area>/*.cc, or those of the folders,
# in one GoogleTest program named zor_<area>_tests. Tests that cost more begin earlier, and those that mostly wait before them.
function(zor_test area)
    cmake_parse_arguments(ARG "" "COST;WAITING" "DIR;LINK" ${ARGN})
    if(NOT ARG_COST)
        set(ARG_COST 0)
    endif()
    if(NOT ARG_DIR)
        set(ARG_DIR ${area})
    endif()
    list(TRANSFORM ARG_DIR APPEND /*.cc)
    list(TRANSFORM ARG_DIR PREPEND ${CMAKE_CURRENT_SOURCE_DIR}/)
    file(GLOB sources CONFIGURE_DEPENDS ${ARG_DIR})
    if(NOT sources)
        return()
    endif()
    add_executable(zor_${area}_tests ${sources})
    zor_compile_together(zor_${area}_tests)
    zor_use_pch(zor_${area}_tests)
    target_include_directories(zor_${area}_tests PRIVATE ${CMAKE_SOURCE_DIR}/tests)
    target_compile_definitions(zor_${area}_tests PRIVATE ZORVANE_SOURCE_DIR="${CMAKE_SOURCE_DIR}"
        ZORVANE_BINARY_DIR="${CMAKE_BINARY_DIR}")
    target_link_libraries(zor_${area}_tests PRIVATE zor_options ${ARG_LINK} GTest::gtest GTest::gtest_main)
    set(discovery DISCOVERY_MODE PRE_TEST NO_PRETTY_VALUES)
    if(ARG_WAITING)
        gtest_discover_tests(zor_${area}_tests TEST_FILTER "${ARG_WAITING}" TEST_LIST zor_${area}_waiting ${discovery}
            PROPERTIES TIMEOUT 300 COST 500)
    endif()
    gtest_discover_tests(zor_${area}_tests TEST_FILTER "*-${ARG_WAITING}" ${discovery}
        PROPERTIES TIMEOUT 300 COST ${ARG_COST})
endfunction()

# zor_fuzz(name LINK libs...): fuzz/<name>.cc as a libFuzzer program. Its seeds are the files in fuzz/seeds/<name>/.
function(zor_fuzz name)
    cmake_parse_arguments(ARG "" "" "LINK" ${ARGN})
    add_executable(${name} ${CMAKE_SOURCE_DIR}/fuzz/${name}.cc)
    target_link_libraries(${name} PRIVATE zor_options ${ARG_LINK})
    target_link_options(${name} PRIVATE -fsanitize=fuzzer)
endfunction()
