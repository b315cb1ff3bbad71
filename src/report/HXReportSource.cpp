#include "report/HXReportSource.h"

#include "analysis/HXHeft.h"
#include "platform/replay/HXReplayPlatform.h"
#include "process/HXProcessSnapshot.h"
#include "report/HXReportFormatter.h"
#include "report/HXReportReader.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace {

bool readWhole(HXServices &services, const std::string &path, std::string *text, std::string *reason) {
    std::FILE *const file = services.openForReading(path);
    if (!file) {
        *reason = std::strerror(errno);
        return false;
    }
    constexpr size_t step = 1 << 20;
    size_t length = 0;
    size_t taken = 0;
    do {
        text->resize(length + step);
        taken = std::fread(text->data() + length, 1, step, file);
        length += taken;
    } while (taken == step);
    text->resize(length);
    const bool failed = std::ferror(file) != 0;
    if (failed) *reason = std::strerror(errno);
    std::fclose(file);
    return !failed;
}

// What heft -a tells of the current platform.
std::optional<HXReport> analyse(bool listsRegions, std::string *reason) {
    HXProcess::_clearGlobalErrors();
    HXHeft::setBreakDownPhysHeft(true);
    HXHeft::setExaminesWholeMachine(true);
    HXHeft::ProcessList targets;
    {
        HXProcessSnapshot snapshot;
        auto all = snapshot.allProcessesExcludingPids({});
        if (!all || all->empty()) {
            *reason = "no processes can be examined";
            return std::nullopt;
        }
        for (auto &[pid, process] : *all)
            targets.push_back(std::move(process));
    }
    HXHeft heft(std::move(targets));
    heft.gatherData();
    std::optional<HXReport> report(std::in_place);
    HXReportFormatter formatter(*report, listsRegions);
    heft.addOutputFormatter(formatter);
    heft.printOutputVerbose(listsRegions, true);
    return report;
}

} // namespace

std::unique_ptr<HXReportSource> HXReportSource::withPath(const std::string &path, std::string *reason) {
    auto source = std::make_unique<HXReportSource>();
    source->_live = std::make_unique<HXLinuxPlatform>();
    std::string text;
    if (!readWhole(source->_live->services(), path, &text, reason)) return nullptr;
    if (text.starts_with("heft-machine")) {
        source->_machine = HXMachine::loadText(text, reason);
        if (!source->_machine) return nullptr;
    } else {
        source->_document = std::move(text);
    }
    return source;
}

std::optional<HXReport> HXReportSource::read(bool listsRegions, std::string *reason) {
    if (_document) return HXReadReport(*_document, listsRegions, reason);
    if (_machine) {
        HXReplayPlatform replay(*_machine, _live->services());
        HXPlatform::setCurrent(&replay);
        auto report = analyse(listsRegions, reason);
        HXPlatform::setCurrent(_live.get());
        return report;
    }
    // What the host remembers of one reading can be wrong in the next.
    if (_live && _live->hasGivenUp()) _kept.push_back(std::move(_live));
    _live = std::make_unique<HXLinuxPlatform>();
    HXPlatform::setCurrent(_live.get());
    return analyse(listsRegions, reason);
}

int HXReportSource::finish(int status) {
    if (_kept.empty() && !(_live && _live->hasGivenUp())) return status;
    std::fflush(stdout);
    ::_exit(status); // somebody may still use what would be destroyed
}
