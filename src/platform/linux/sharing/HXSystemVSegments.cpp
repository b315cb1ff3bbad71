#include "platform/linux/sharing/HXSystemVSegments.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>
#include <sched.h>

#include <optional>
#include <system_error>
#include <thread>

std::vector<HXSystemVSegment> HXParseSystemVSegments(std::string_view text) {
    std::vector<HXSystemVSegment> segments;
    HXTextCursor cursor{text};
    const std::string_view titles = cursor.line();
    while (!cursor.rest.empty()) {
        HXTextCursor title{titles}, line{cursor.line()};
        HXSystemVSegment segment;
        size_t found = 0;
        const auto take = [&](std::string_view word, auto *value) { found += HXIsNumber(word, value); };
        for (std::string_view name = title.word(); !name.empty(); name = title.word()) {
            const std::string_view word = line.word();
            if (name == "shmid") take(word, &segment.identifier);
            if (name == "cpid") take(word, &segment.creatorPid);
            if (name == "cuid") take(word, &segment.creatorUser);
            if (name == "nattch") take(word, &segment.attachedCount);
            if (name == "rss") take(word, &segment.residentSize);
            if (name == "swap") take(word, &segment.swappedSize);
        }
        constexpr size_t wanted = 6;
        if (found == wanted) segments.push_back(segment);
    }
    return segments;
}

// The file shows the namespace of the thread that opens it, so one of its own enters that of the process
// (setns(2)).
std::vector<HXSystemVSegment> HXReadSystemVSegments(const std::string &procPath,
                                                    const HXDescriptor &process) {
    const HXDescriptor space = HXOpenAt(process, "ns/ipc");
    if (!space) return {};
    std::optional<std::string> text;
    try {
        std::thread([&] {
            if (::setns(space.get(), CLONE_NEWIPC) == 0)
                text = HXReadText(AT_FDCWD, (procPath + "/sysvipc/shm").c_str());
        }).join();
    } catch (const std::system_error &) { // there are too many
        return {};
    }
    return text ? HXParseSystemVSegments(*text) : std::vector<HXSystemVSegment>();
}
