#include "platform/linux/HXTerminal.h"

#include <sys/ioctl.h>
#include <unistd.h>

HXTerminalSize HXSizeOfTerminal() {
    HXTerminalSize size;
    winsize window = {};
    if (::ioctl(STDOUT_FILENO, TIOCGWINSZ, &window) == 0 && window.ws_row > 0 && window.ws_col > 0)
        size = {window.ws_row, window.ws_col};
    return size;
}
