// SPDX-License-Identifier: Apache-2.0
#include "Screen.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/ioctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zorvanectl {

namespace {

constexpr std::size_t usualColumns = 80;

bool isSet(const char* variable) {
    const char* const value = std::getenv(variable);
    return value && *value != '\0';
}

bool knowsTerminal() {
    const char* const terminal = std::getenv("TERM");
    return terminal && std::strcmp(terminal, "dumb") != 0;
}

/// In the pager's process. Never returns.
[[noreturn]] void executePager(int input) {
    (void)::dup3(input, STDIN_FILENO, 0);
    (void)std::signal(SIGPIPE, SIG_DFL);
    // Quit where all fits, show colours, leave the text on the terminal, go on after an interrupt.
    (void)::setenv("LESS", "FRXMK", 0);
    (void)::setenv("LESSCHARSET", "utf-8", 0);
    // A user who may only look, and became root for that, gets no shell.
    if (::geteuid() == 0)
        (void)::setenv("LESSSECURE", "1", 1);
    if (isSet("PAGER"))
        (void)::execl("/bin/sh", "sh", "-c", std::getenv("PAGER"), nullptr);
    else
        for (const char* const program : {"less", "cat"})
            (void)::execlp(program, program, nullptr);
    ::_exit(127);
}

} // namespace

bool isColoured(int descriptor) {
    return !isSet("NO_COLOR") && knowsTerminal() && ::isatty(descriptor) != 0;
}

Screen& Screen::ofOutput() {
    static Screen screen;
    return screen;
}

Screen::Screen() : isColoured_(zorvanectl::isColoured(STDOUT_FILENO)) {
    if (::isatty(STDOUT_FILENO) == 0)
        return;
    winsize size{};
    columns_ = ::ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0 ? size.ws_col : usualColumns;
    const char* const pager = std::getenv("PAGER");
    mayPage_ = knowsTerminal() && ::isatty(STDIN_FILENO) != 0 &&
               (!pager || (*pager != '\0' && std::strcmp(pager, "cat") != 0));
}

void Screen::page() {
    int ends[2];
    if (!mayPage_ || isPaged() || std::fflush(stdout) != 0 || ::pipe2(ends, O_CLOEXEC) != 0)
        return;
    pager_ = ::fork();
    if (pager_ == 0)
        executePager(ends[0]);
    if (pager_ > 0) {
        (void)std::signal(SIGPIPE, SIG_IGN);
        (void)std::signal(SIGINT, SIG_IGN); // the pager's to take
        (void)::dup3(ends[1], STDOUT_FILENO, 0);
    }
    ::close(ends[0]);
    ::close(ends[1]);
}

void Screen::end() {
    if (!isPaged())
        return;
    ::close(STDOUT_FILENO);
    while (::waitpid(pager_, nullptr, 0) < 0 && errno == EINTR)
        ;
    pager_ = 0;
}

} // namespace zorvanectl
