// heft-record: writes captures of the live machine.
#include "model/HXMemoryRegion.h"
#include "platform/HXVersion.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "process/HXProcessSnapshot.h"
#include "record/HXMachineRecorder.h"
#include "record/HXMemgraphRecorder.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace {

constexpr char kUsage[] =
    "Usage: heft-record machine [--anonymize] FILE [PID...]\n"
    "       heft-record memgraph [--vmObjectDirty] PID FILE\n"
    "       heft-record --help | --version\n"
    "\n"
    "machine   writes the whole machine, or only the processes PID, as a machine file for heft-replay\n"
    "memgraph  writes the memory graph of a process, which heft takes as a target\n"
    "\n"
    "--anonymize      replace the names of programs, files and memory by made-up ones\n"
    "--vmObjectDirty  write what the memory objects see, not the breakdown of the heft\n"
    "\n"
    "FILE appears when it is complete, readable by its owner alone; a pipe or device is written as it "
    "stands, and - is standard output. Ends 3 when nobody's memory could be read.\n";

using Words = std::vector<std::string_view>;

int fail(std::string_view subject, std::string_view problem) {
    std::fprintf(stderr, "heft-record: %.*s: %.*s\n", static_cast<int>(subject.size()), subject.data(),
                 static_cast<int>(problem.size()), problem.data());
    return 1;
}

int failUsage() {
    std::fputs(kUsage, stderr);
    return 1;
}

// The process that `word` names; none, told on standard error, when there is none.
std::optional<int32_t> parsePid(HXPlatform &host, std::string_view word) {
    const char *const end = word.data() + word.size();
    int32_t pid = 0;
    const auto [stop, error] = std::from_chars(word.data(), end, pid);
    if (error != std::errc() || stop != end || pid < 0) {
        fail(word, "not a process id");
        return std::nullopt;
    }
    proc_bsdshortinfo info;
    if (pid == 0 || host.proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof info) != 0) return pid;
    fail(word, std::strerror(errno));
    return std::nullopt;
}

constexpr int kNothingRead = 3, kUnwritten = -1;

// Writes `path`, or standard output for "-", with `write`: it answers the exit status, having told itself
// what fails, or kUnwritten with errno set. The file appears only when the status is 0 or kNothingRead.
int writeFile(HXServices &services, const std::string &path, const std::function<int(std::FILE *)> &write) {
    const bool isOutput = path == "-";
    const std::string name = isOutput ? "standard output" : path;
    std::optional<HXPendingFile> file = services.createPendingFile(isOutput ? "/dev/stdout" : path);
    if (!file) return fail(name, std::strerror(errno));
    // A reader that goes away is a failed write; only that of standard output may.
    if (!isOutput) services.signal(HX_SIGPIPE, HXSignalDisposition::ignored);
    int status = write(file->stream);
    const bool isWhole = status == 0 || status == kNothingRead;
    if (isWhole) std::fprintf(file->stream, "# heft-record %s\n", kHXVersion);
    if (isWhole && !services.commitPendingFile(*file)) status = kUnwritten;
    if (!isWhole) services.discardPendingFile(*file);
    if (status != kUnwritten) return status;
    return isOutput && errno == EPIPE ? 0 : fail(name, std::strerror(errno));
}

int recordMachine(HXPlatform &host, const Words &words, bool anonymize) {
    const std::string path(words[0]);
    std::vector<int32_t> pids;
    for (size_t i = 1; i < words.size(); i++) {
        const auto pid = parsePid(host, words[i]);
        if (!pid) return 1;
        if (std::find(pids.begin(), pids.end(), *pid) == pids.end()) pids.push_back(*pid); // recorded once
    }
    const auto notTold = host.processesNotTold(pids.empty());
    if (notTold) std::fprintf(stderr, "heft-record: %s\n", notTold->c_str());
    return writeFile(host.services(), path, [&](std::FILE *out) {
        HXMachineRecorder recorder(host, out, anonymize);
        if (!recorder.record(pids)) return kUnwritten;
        if (!recorder.hasRecords()) return fail(path, "no process was recorded");
        const size_t unreadable = recorder.unreadableCount(), all = recorder.readCount() + unreadable;
        if (unreadable > 0)
            std::fprintf(stderr, "heft-record: %zu of %zu processes could not be read%s\n", unreadable, all,
                         host.geteuid() == 0 ? "" : " (try as root?)");
        return recorder.readCount() > 0 || recorder.hasKernelMemory() ? 0 : kNothingRead;
    });
}

int recordMemgraph(HXPlatform &host, const Words &words, bool vmObjectDirty) {
    const auto pid = parsePid(host, words[0]);
    if (!pid) return 1;
    HXProcessSnapshot snapshot;
    const auto info = snapshot.bsdInfoOfPid(*pid);
    if (!info) return fail(words[0], std::strerror(errno));
    return writeFile(host.services(), std::string(words[1]), [&](std::FILE *out) {
        std::string reason;
        const auto categoryName = [](uint32_t tag) { return HXMemoryRegion::categoryNameForTag(tag).str(); };
        if (HXMemgraphRecorder::record(host, out, categoryName,
                                       {*pid, snapshot.nameOf(*info), !vmObjectDirty}, &reason))
            return 0;
        return fail(words[0], reason);
    });
}

// A capture: its name on the command line, the one option that may follow, how many words must and may come
// then, and what writes it.
struct Capture {
    std::string_view name;
    std::string_view option;
    size_t fewestWords;
    size_t mostWords;
    int (*record)(HXPlatform &host, const Words &words, bool hasOption);
};
constexpr Capture kCaptures[] = {
    {"machine", "--anonymize", 1, SIZE_MAX, recordMachine},
    {"memgraph", "--vmObjectDirty", 2, 2, recordMemgraph},
};

int run(HXPlatform &live, Words words) {
    if (words.empty()) return failUsage();
    if (words[0] == "--help" || words[0] == "-h") {
        std::fputs(kUsage, stdout);
        return 0;
    }
    if (words[0] == "--version") {
        std::printf("heft-record %s\n", kHXVersion);
        return 0;
    }
    for (const Capture &capture : kCaptures) {
        if (words[0] != capture.name) continue;
        const bool hasOption = words.size() > 1 && words[1] == capture.option;
        words.erase(words.begin(), words.begin() + (hasOption ? 2 : 1));
        if (words.size() < capture.fewestWords || words.size() > capture.mostWords ||
            (words[0].starts_with('-') && words[0] != "-"))
            return failUsage();
        return capture.record(live, words, hasOption);
    }
    return failUsage();
}

} // namespace

int main(int argc, char *argv[]) {
    static HXLinuxPlatform live;
    live.prepareProcess("heft-record");
    HXPlatform::setCurrent(&live);
    return live.services().finish("heft-record", run(live, Words(argv + 1, argv + argc)));
}
