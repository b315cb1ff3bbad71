// heft with a forced reader of address spaces, for comparisons: heft-variant smaps|maps [heft's arguments].
#include "cli/HXHeftMain.h"
#include "platform/linux/HXLinuxPlatform.h"

#include <cstdio>
#include <cstring>

int main(int argc, char *argv[]) {
    const bool maps = argc > 1 && strcmp(argv[1], "maps") == 0;
    if (!maps && (argc < 2 || strcmp(argv[1], "smaps") != 0)) {
        fprintf(stderr, "usage: heft-variant smaps|maps [heft's arguments]\n");
        return 1;
    }
    HXLinuxPlatform::Setting setting;
    setting.mayScanPageTables = maps;
    static HXLinuxPlatform platform(setting);
    platform.prepareProcess();
    HXPlatform::setCurrent(&platform);
    return HXHeftMain(argc - 1, argv + 1);
}
