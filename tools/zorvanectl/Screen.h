// SPDX-License-Identifier: Apache-2.0
// The terminal that standard output leads to, if it does: its width, whether it has colours, and a pager for what is
// longer than it. Elsewhere there is neither, so that programs read the same text everywhere.
//
// A pager takes standard output over once it has been asked for. Its end is waited for: two programs must not read the
// terminal at once. One that is left early wants no more, which is no error.
#pragma once

#include <cstddef>
#include <sys/types.h>

namespace zorvanectl {

class Screen {
public:
    /// That of this process.
    static Screen& ofOutput();
    /// 0: no terminal.
    [[nodiscard]] std::size_t columns() const { return columns_; }
    [[nodiscard]] bool isColoured() const { return isColoured_; }
    void leavePlain() { mayPage_ = false; }
    /// The text that is written from here on may be long.
    void page();
    [[nodiscard]] bool isPaged() const { return pager_ > 0; }
    /// When all is written.
    void end();

private:
    Screen();
    std::size_t columns_ = 0;
    bool isColoured_ = false;
    bool mayPage_ = false;
    pid_t pager_ = 0;
};

/// Colours are for people's terminals, and only where they want them.
[[nodiscard]] bool isColoured(int descriptor);

} // namespace zorvanectl
