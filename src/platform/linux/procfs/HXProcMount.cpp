#include "platform/linux/procfs/HXProcMount.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>
#include <unistd.h>

namespace {

// The words of the line that begins with `label`.
HXTextCursor wordsBehind(std::string_view text, std::string_view label) {
    for (HXTextCursor cursor{text}; !cursor.rest.empty();) {
        const std::string_view line = cursor.line();
        if (line.starts_with(label)) return {line.substr(label.size())};
    }
    return {};
}

// Whoever may trace every process sees every process.
bool mayTraceAll(std::string_view status) {
    constexpr int capSysPtrace = 19; // capabilities(7)
    uint64_t capabilities = 0;
    return HXIsNumber(wordsBehind(status, "CapEff:").word(), &capabilities, 16) &&
           capabilities >> capSysPtrace & 1;
}

bool isInGroup(std::string_view status, uint32_t group) {
    HXTextCursor ids = wordsBehind(status, "Gid:");
    ids.word(); // the real one
    uint32_t id = 0;
    if (HXIsNumber(ids.word(), &id) && id == group) return true;
    for (HXTextCursor groups = wordsBehind(status, "Groups:"); !groups.rest.empty();)
        if (HXIsNumber(groups.word(), &id) && id == group) return true;
    return false;
}

// The value of an option; empty when it is not there.
std::string_view valueOf(std::string_view options, std::string_view name) {
    while (!options.empty()) {
        const size_t end = options.find(',');
        const std::string_view option = options.substr(0, end);
        options.remove_prefix(end == std::string_view::npos ? options.size() : end + 1);
        if (option.starts_with(name)) return option.substr(name.size());
    }
    return {};
}

} // namespace

bool HXIsProcMounted(const std::string &procPath) {
    // Where the caller is no process of the mounted one, the link leads nowhere, but it is there.
    return ::faccessat(AT_FDCWD, (procPath + "/self").c_str(), F_OK, AT_SYMLINK_NOFOLLOW) == 0;
}

bool HXHidesProcesses(std::string_view mountinfo, std::string_view status, std::string_view procPath) {
    std::string options; // of the last mount there, which covers the others
    HXParseMountInfo(mountinfo, [&](const HXMount &mount) {
        if (mount.point == procPath && mount.type == "proc") options = mount.options;
    });
    const std::string_view mode = valueOf(options, "hidepid=");
    if (mode.empty() || mode == "0" || mode == "off" || mayTraceAll(status)) return false;
    uint32_t group = 0; // of those that see all, but for "ptraceable"
    if (mode == "4" || mode == "ptraceable") return true;
    HXIsNumber(valueOf(options, "gid="), &group);
    return !isInGroup(status, group);
}

std::optional<std::string> HXProcessesNotTold(const std::string &procPath, bool ofAll) {
    if (!HXIsProcMounted(procPath)) return procPath + " is not mounted";
    if (!ofAll) return std::nullopt;
    const auto mountinfo = HXReadText(AT_FDCWD, (procPath + "/self/mountinfo").c_str());
    const auto status = HXReadText(AT_FDCWD, (procPath + "/self/status").c_str());
    if (!mountinfo || !status || !HXHidesProcesses(*mountinfo, *status, procPath)) return std::nullopt;
    return procPath + " hides processes (it is mounted with hidepid, and CAP_SYS_PTRACE is missing)";
}
