// The terminal on standard output.
#pragma once

#include <cstddef>

struct HXTerminalSize {
    size_t rows = 24;
    size_t columns = 80;
};
// Its size now (ioctl_tty(2)), that of an old terminal where it does not tell.
HXTerminalSize HXSizeOfTerminal();
