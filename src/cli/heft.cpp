// heft: how much physical memory the kernel charges to processes, and for what.
#include "cli/HXHeftMain.h"
#include "platform/HXPlatform.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "platform/linux/HXProgressLine.h"

int main(int argc, char *argv[]) {
    static HXLinuxPlatform platform;
    platform.prepareProcess("heft");
    HXPlatform::setCurrent(&platform);
    static HXProgressLine progress(platform.services());
    return platform.services().finish("heft", HXHeftMain(argc, argv));
}
