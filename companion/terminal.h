#pragma once

#include <iostream>

#include <sys/ioctl.h>
#include <unistd.h>

/// The columns of the terminal that `out` is, or 100 where it is none.
inline std::size_t widthOf(const std::ostream& out)
{
    winsize window = {};
    const bool known =
        out.rdbuf() == std::cout.rdbuf() && ioctl(STDOUT_FILENO, TIOCGWINSZ, &window) == 0 && window.ws_col > 0;
    return known ? window.ws_col : 100;
}
