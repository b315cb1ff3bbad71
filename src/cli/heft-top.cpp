// heft-top: what every process or group of processes holds, and what stopping it would free.
#include "platform/HXSafeText.h"
#include "platform/linux/HXTerminal.h"
#include "report/HXCompanion.h"
#include "report/HXReportSource.h"
#include "report/HXTop.h"

#include <malloc.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <ctime>
#include <mutex>

namespace {

const HXCompanion kProgram = {
    "heft-top",
    "Usage: heft-top [options] [FILE.machine | REPORT.json]\n"
    "\n"
    "A line for each process or group: its heft, what stopping it would free, what others hold, too.\n"
    "Of the live machine (as root), a machine file or a JSON report of heft.\n"
    "\n"
    "  -b, --by WHAT          process (the default), command, user, unit or container\n"
    "  -n, --lines N          at most N lines of groups\n"
    "  -s, --sort COLUMN      heft (the default), freed, shared, swapped, reclaimable, cgroup, change,\n"
    "                         growth, processes or name\n"
    "  -w, --watch SECONDS    read again and again, with the changes\n"
    "  -c, --count N          end after N readings\n"
    "      --fail-above SIZE  end with status 4 when a group's heft is above SIZE (as 500M or 2G)\n"
    "  -j, --json             write JSON, an object and a line for each reading\n"};

constexpr int kTrouble = 1;
constexpr int kAbove = 4;

struct Setting {
    HXTopSetting top;
    std::optional<double> interval; // seconds
    uint64_t readings = 0;          // 0: for ever, when watching
    std::optional<uint64_t> limit;
    bool isJson = false;
};

std::string takeChoice(const std::vector<std::string> &names, const std::string &argument,
                       std::string *taken) {
    if (std::ranges::find(names, argument) != names.end()) {
        *taken = argument;
        return "";
    }
    std::string all;
    for (const std::string &name : names)
        all += (all.empty() ? "" : ", ") + name;
    return "'" + argument + "' is none of " + all;
}

std::vector<HXCompanionOption> optionsFor(Setting &setting) {
    const auto count = [](auto *taken) {
        return [taken](const std::string &argument) -> std::string {
            const auto number = HXParseCount(argument, INT32_MAX);
            if (!number || *number == 0) return "'" + argument + "' is no number above 0";
            *taken = *number;
            return "";
        };
    };
    return {
        {"by", 'b', true,
         [&](const std::string &argument) {
             std::string name;
             auto problem = takeChoice({std::begin(kGroupByNames), std::end(kGroupByNames)}, argument, &name);
             if (problem.empty()) setting.top.by = *HXGroupByOfName(name);
             return problem;
         }},
        {"lines", 'n', true, count(&setting.top.most)},
        {"sort", 's', true,
         [&](const std::string &argument) {
             return takeChoice(HXTop::sortNames(), argument, &setting.top.sort);
         }},
        {"watch", 'w', true,
         [&](const std::string &argument) -> std::string {
             double seconds = 0;
             const char *const end = argument.data() + argument.size();
             const auto [stop, error] = std::from_chars(argument.data(), end, seconds);
             constexpr double most = 1e6;
             if (error != std::errc() || stop != end || !(seconds >= 0) || seconds > most)
                 return "'" + argument + "' is no number of seconds";
             setting.interval = seconds;
             setting.top.showsChanges = true;
             return "";
         }},
        {"count", 'c', true, count(&setting.readings)},
        {"fail-above", '\0', true,
         [&](const std::string &argument) -> std::string {
             setting.limit = HXParseSize(argument);
             return setting.limit ? "" : "'" + argument + "' is no size";
         }},
        {"json", 'j', false,
         [&](const std::string &) {
             setting.isJson = true;
             return "";
         }},
    };
}

// Tells what one option asks of another.
bool isConsistent(const Setting &setting) {
    if (setting.readings > 0 && !setting.interval) {
        kProgram.complain("--count", "there is one reading without --watch");
        return false;
    }
    if (HXTop::hasSortColumn(setting.top)) return true;
    kProgram.complain("--sort", "the table has no column " + setting.top.sort + " with these options");
    return false;
}

// Waits between readings, until an interrupt from the keyboard.
class Pause {
  public:
    explicit Pause(HXServices &services)
        : _services(services), _source(services.dispatch_source_create(HX_SIGINT)) {
        if (!_source) return;
        _services.dispatch_source_set_event_handler(*_source, [this] {
            const std::lock_guard lock(_mutex);
            _isInterrupted = true;
            _services.signal(HX_SIGINT, HXSignalDisposition::byDefault); // the next one does not wait
            _changed.notify_all();
        });
        _services.signal(HX_SIGINT, HXSignalDisposition::ignored);
        _services.dispatch_resume(*_source);
    }
    ~Pause() {
        if (_source) _services.dispatch_source_cancel(*_source);
    }
    Pause(const Pause &) = delete;
    Pause &operator=(const Pause &) = delete;

    bool isInterrupted() {
        const std::lock_guard lock(_mutex);
        return _isInterrupted;
    }
    // False when interrupted.
    bool wait(double seconds) {
        ::malloc_trim(0); // what a reading takes is others' meanwhile
        std::unique_lock lock(_mutex);
        _changed.wait_for(lock, std::chrono::duration<double>(seconds), [this] { return _isInterrupted; });
        return !_isInterrupted;
    }

  private:
    HXServices &_services;
    std::unique_ptr<HXDispatchSource> _source;
    std::mutex _mutex;
    std::condition_variable _changed;
    bool _isInterrupted = false;
};

std::string timeNow() {
    const std::time_t now = std::time(nullptr);
    char text[32];
    return {text, std::strftime(text, sizeof text, "%F %T", std::localtime(&now))};
}

// Over what stands there. Lines are cut to the width, so that they take a row each.
void printInPlace(const HXTop &top, uint64_t reading) {
    const HXTerminalSize size = HXSizeOfTerminal();
    constexpr size_t otherRows = 4; // the time, the titles, the kernel and the total
    const size_t rows = size.rows > otherRows ? size.rows - otherRows : 1;
    std::vector<std::string> lines = top.lines(rows);
    lines.insert(lines.begin(), "heft-top, reading " + std::to_string(reading) + ", " + timeNow());
    std::string screen = reading == 1 ? "\033[2J\033[H" : "\033[H";
    for (size_t i = 0; i < lines.size(); i++)
        screen += (i > 0 ? "\n" : "") + std::string(HXCutText(lines[i], size.columns - 1)) + "\033[K";
    screen += "\033[J";
    std::fwrite(screen.data(), 1, screen.size(), stdout);
}

void printBlock(const HXTop &top, const Setting &setting, uint64_t reading) {
    if (setting.isJson) {
        std::printf("%s\n", top.json().c_str());
        return;
    }
    if (setting.interval) std::printf("%s%s\n", reading > 1 ? "\n" : "", timeNow().c_str());
    for (const std::string &line : top.lines(SIZE_MAX))
        std::printf("%s\n", line.c_str());
}

// Tells the groups above the limit; whether there are any.
bool isAboveLimit(const HXTop &top, const Setting &setting) {
    if (!setting.limit) return false;
    bool isAbove = false;
    for (const HXTop::Row &row : top.rows()) {
        if (row.heft <= *setting.limit) continue;
        isAbove = true;
        kProgram.complain(row.name, HXShortSize(row.heft) + " is above " + HXShortSize(*setting.limit));
    }
    return isAbove;
}

class Run {
  public:
    Run(HXLinuxPlatform &own, Setting setting, std::optional<std::string> path)
        : _services(own.services()), _setting(std::move(setting)), _path(std::move(path)),
          _top(_setting.top) {}

    int run() {
        if (!_path && HXPlatform::current().geteuid() != 0) {
            kProgram.complain("the live machine", "must run as root");
            return kTrouble;
        }
        _services.signal(HX_SIGPIPE, HXSignalDisposition::ignored);
        const bool isInPlace = _setting.interval && !_setting.isJson && _services.isatty(1);
        // What is told of processes that end meanwhile would stand in the table.
        if (isInPlace && _services.isatty(2) && !std::freopen("/dev/null", "w", stderr)) return kTrouble;
        int status = _setting.interval ? watch(isInPlace) : takeReading() ? 0 : kTrouble;
        if (!_setting.interval && status == 0) {
            printBlock(_top, _setting, 1);
            if (isAboveLimit(_top, _setting)) status = kAbove;
        }
        if (isInPlace) std::fputs("\n", stdout);
        return kProgram.finishOutput() ? status : kTrouble;
    }
    int finish(int status) { return _source ? _source->finish(status) : status; }

  private:
    bool takeReading() {
        std::string reason;
        if (_path) {
            _source = HXReportSource::withPath(*_path, &reason); // as it is now
        } else if (!_source) {
            _source = std::make_unique<HXReportSource>();
        }
        const auto report = _source ? _source->read(false, &reason) : std::nullopt;
        if (!report) {
            kProgram.complain(_path.value_or("the live machine"), reason);
            return false;
        }
        if (!report->hasKernel() && !_hasWarned) {
            kProgram.complain(_path.value_or(""),
                              "not a report of all processes: what others hold is not known");
            _hasWarned = true;
        }
        _top.take(HXGroupReport(*report, _setting.top.by, _path ? nullptr : &_places));
        return true;
    }

    int watch(bool isInPlace) {
        Pause pause(_services);
        for (uint64_t reading = 1;; reading++) {
            if (!takeReading()) return kTrouble;
            if (pause.isInterrupted()) return 0;
            if (isInPlace)
                printInPlace(_top, reading);
            else
                printBlock(_top, _setting, reading);
            if (std::fflush(stdout) != 0) return kTrouble;
            if (isAboveLimit(_top, _setting)) return kAbove;
            if (reading == _setting.readings || !pause.wait(*_setting.interval)) return 0;
        }
    }

    HXServices &_services;
    const Setting _setting;
    const std::optional<std::string> _path;
    HXTop _top;
    HXProcessPlaces _places;
    std::unique_ptr<HXReportSource> _source;
    bool _hasWarned = false;
};

} // namespace

int main(int argc, char *argv[]) {
    static HXLinuxPlatform own;
    HXLinuxPlatform::prepareProcess("heft-top");
    HXPlatform::setCurrent(&own);
    Setting setting;
    int status = 0;
    const auto words =
        kProgram.words(own.services(), argc, argv, optionsFor(setting), 0, 1, kTrouble, &status);
    if (!words) return status;
    if (!isConsistent(setting)) return kTrouble;
    static Run run(own, setting, words->empty() ? std::nullopt : std::optional(words->front()));
    return run.finish(run.run());
}
