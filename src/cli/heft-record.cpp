// heft-record: writes captures of the live machine.
#include "model/HXMemoryRegion.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "process/HXProcess.h"
#include "record/HXMachineRecorder.h"
#include "record/HXMemgraphRecorder.h"

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace {

constexpr char kUsage[] =
    "Usage: heft-record machine [--anonymize] FILE [PID...]\n"
    "       heft-record memgraph [--vmObjectDirty] PID FILE\n"
    "\n"
    "machine   writes the whole machine, or only the processes PID, as a machine file for heft-replay\n"
    "memgraph  writes the memory graph of a process, which heft takes as a target\n"
    "\n"
    "--anonymize      replace the names of programs, files and memory by made-up ones\n"
    "--vmObjectDirty  write what the memory objects see, not the breakdown of the heft\n"
    "\n"
    "FILE appears when it is complete, readable by its owner alone.\n";

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

// Whether `word` is there as an option before the other words; takes it away.
bool takeOption(Words &words, std::string_view word) {
    const bool found = !words.empty() && words.front() == word;
    if (found) words.erase(words.begin());
    return found;
}

// The process that `word` names, told on standard error when there is none.
bool parsePid(HXPlatform &host, std::string_view word, int32_t *pid) {
    const char *const end = word.data() + word.size();
    const auto [stop, error] = std::from_chars(word.data(), end, *pid);
    if (error != std::errc() || stop != end || *pid < 0) {
        fail(word, "not a process id");
        return false;
    }
    proc_bsdshortinfo info;
    if (*pid == 0 || host.proc_pidinfo(*pid, PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof info) != 0) return true;
    fail(word, std::strerror(errno));
    return false;
}

// Writes `path` with `write`, which tells itself what fails; the file appears only when all succeeds.
int writeFile(HXServices &services, const std::string &path, const std::function<bool(std::FILE *)> &write) {
    std::optional<HXPendingFile> file = services.createPendingFile(path);
    if (!file) return fail(path, std::strerror(errno));
    if (!write(file->stream)) {
        services.discardPendingFile(*file);
        return 1;
    }
    return services.commitPendingFile(*file) ? 0 : fail(path, std::strerror(errno));
}

int recordMachine(HXPlatform &host, Words words) {
    const bool anonymize = takeOption(words, "--anonymize");
    if (words.empty() || words.front().starts_with("-")) return failUsage();
    const std::string path(words.front());
    std::vector<int32_t> pids;
    for (size_t i = 1; i < words.size(); i++)
        if (!parsePid(host, words[i], &pids.emplace_back())) return 1;
    return writeFile(host.services(), path, [&](std::FILE *out) {
        HXMachineRecorder recorder(host, out, anonymize);
        if (!recorder.record(pids)) {
            fail(path, std::strerror(errno));
            return false;
        }
        if (recorder.processCount() > 0) return true;
        fail(path, "no process was recorded");
        return false;
    });
}

int recordMemgraph(HXPlatform &host, Words words) {
    const bool vmObjectDirty = takeOption(words, "--vmObjectDirty");
    if (words.size() != 2 || words.front().starts_with("-")) return failUsage();
    int32_t pid = 0;
    if (!parsePid(host, words[0], &pid)) return 1;
    proc_bsdinfo info{};
    if (host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info) != int32_t{sizeof info})
        return fail(words[0], std::strerror(errno));
    return writeFile(host.services(), std::string(words[1]), [&](std::FILE *out) {
        HXMemgraphRecorder recorder(
            host, out, [](uint32_t tag) { return HXMemoryRegion::categoryNameForTag(tag).str(); });
        std::string reason;
        if (recorder.record(pid, HXProcess::_nameForBsdInfo(info), !vmObjectDirty, &reason)) return true;
        fail(words[0], reason);
        return false;
    });
}

} // namespace

int main(int argc, char *argv[]) {
    Words words(argv + 1, argv + argc);
    if (words.empty()) return failUsage();
    if (words[0] == "--help" || words[0] == "-h") {
        std::fputs(kUsage, stdout);
        return 0;
    }
    static HXLinuxPlatform live;
    live.prepareProcess();
    HXPlatform::setCurrent(&live);
    if (takeOption(words, "machine")) return recordMachine(live, words);
    if (takeOption(words, "memgraph")) return recordMemgraph(live, words);
    return failUsage();
}
