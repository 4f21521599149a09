# SPDX-License-Identifier: Apache-2.0
# A lint build: clang-tidy in the compiler's place for what is installed. It reports clang's own warnings with its checks, so
# compiling beside it would parse every file twice; the compiler only lists the headers that a file depends on. Tests and
# benchmarks are compiled. What would be linked is an empty file.
set(CMAKE_EXPORT_COMPILE_COMMANDS OFF)
# The list of checks is part of the command, so that a changed one judges every source anew.
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/.clang-tidy)
file(SHA256 ${CMAKE_SOURCE_DIR}/.clang-tidy checks)
set(ZORVANE_TIDY_OBJECT
    # Without carets it does not count what it leaves out of other people's headers.
    "clang-tidy-19 --quiet <SOURCE> -- <DEFINES> <INCLUDES> <FLAGS> -fno-caret-diagnostics -D ZORVANE_CHECKS=${checks}"
    "<CMAKE_CXX_COMPILER> <DEFINES> <INCLUDES> <FLAGS> -E -o /dev/null <SOURCE>"
    "${CMAKE_COMMAND} -E touch <OBJECT>")
set(CMAKE_CXX_CREATE_STATIC_LIBRARY "${CMAKE_COMMAND} -E touch <TARGET>")
set(CMAKE_CXX_LINK_EXECUTABLE "${CMAKE_COMMAND} -E touch <TARGET>")
