// heft-replay: heft over a machine that a file describes.
#include "cli/HXHeftMain.h"
#include "platform/HXVersion.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "platform/replay/HXReplayPlatform.h"

#include <cstdio>
#include <string>
#include <string_view>
#include <vector>

namespace {

constexpr char kUsage[] =
    "Usage: heft-replay FILE [heft's arguments]\n"
    "       heft-replay --help | --version\n"
    "\n"
    "Prints heft's report on the machine that the machine file FILE describes; - is\n"
    "standard input. heft-record writes such files; heft --help tells heft's arguments.\n";

int run(HXLinuxPlatform &live, int argc, char *argv[]) {
    if (argc < 2) {
        std::fputs(kUsage, stderr);
        return 1;
    }
    if (std::string_view(argv[1]) == "--help" || std::string_view(argv[1]) == "-h") {
        std::fputs(kUsage, stdout);
        return 0;
    }
    if (std::string_view(argv[1]) == "--version") {
        std::printf("heft-replay %s\n", kHXVersion);
        return 0;
    }
    std::string reason;
    static std::unique_ptr<HXMachine> machine;
    const std::string_view path = argv[1];
    machine = HXMachine::load(live.services(), std::string(path == "-" ? "/dev/stdin" : path), &reason);
    if (!machine) {
        std::fprintf(stderr, "%s: %s\n", argv[1], reason.c_str());
        return 1;
    }
    static HXReplayPlatform replay(*machine, live.services());
    HXPlatform::setCurrent(&replay);

    std::vector<char *> arguments = {argv[0]};
    arguments.insert(arguments.end(), argv + 2, argv + argc);
    arguments.push_back(nullptr);
    return HXHeftMain(argc - 1, arguments.data());
}

} // namespace

int main(int argc, char *argv[]) {
    static HXLinuxPlatform live;
    live.prepareProcess("heft-replay");
    return live.services().finish("heft-replay", run(live, argc, argv));
}
