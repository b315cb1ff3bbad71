// heft with a forced reader of address spaces, for comparisons: heft-variant smaps|maps [heft's arguments].
// Where descriptor 9 is open it takes, at the end, the processor time of the main thread in seconds: what is
// done by nobody else.
#include "cli/HXHeftMain.h"
#include "platform/linux/HXLinuxPlatform.h"

#include <cstdio>
#include <cstring>
#include <ctime>

#include <fcntl.h>
#include <unistd.h>

namespace {

double mainThreadSeconds() {
    timespec time{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

} // namespace

int main(int argc, char *argv[]) {
    const double atStart = mainThreadSeconds(); // what its shell and the dynamic linker took
    const bool maps = argc > 1 && strcmp(argv[1], "maps") == 0;
    if (!maps && (argc < 2 || strcmp(argv[1], "smaps") != 0)) {
        fprintf(stderr, "usage: heft-variant smaps|maps [heft's arguments]\n");
        return 1;
    }
    HXLinuxPlatform::Setting setting;
    setting.mayScanPageTables = maps;
    static HXLinuxPlatform platform(setting);
    platform.prepareProcess("heft-variant");
    HXPlatform::setCurrent(&platform);
    const int status = HXHeftMain(argc - 1, argv + 1);
    if (fcntl(9, F_GETFD) >= 0) dprintf(9, "%.6f\n", mainThreadSeconds() - atStart);
    return status;
}
