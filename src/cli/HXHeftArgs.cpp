// The command line.
#include "cli/HXHeftArgs.h"

#include "output/HXOutputFormatterText.h"
#include "platform/HXPlatform.h"

#include <algorithm>
#include <cctype>
#include <cstdlib>

namespace {

// Values of options without a short form.
enum { physHeftOption = 256, vmObjectDirtyOption, swappedOption, wiredOption, sortOption, unmappedOption };

constexpr char kShortOptions[] = "aj:htp:x:svf:yw";

std::string lowered(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](char c) { return static_cast<char>(std::tolower(static_cast<unsigned char>(c))); });
    return text;
}

void setError(HXError *error, HXHeftErrorCode code, std::optional<std::string> description = std::nullopt) {
    if (error) *error = HXError(HXHeftError, code, std::move(description));
}

} // namespace

void HXStringSet::add(const std::string &text) {
    if (std::find(_strings.begin(), _strings.end(), text) == _strings.end()) _strings.push_back(text);
}

void HXStringSet::remove(const std::string &text) {
    std::erase(_strings, text);
}

// The scanner's flag cells.
struct HXHeftArgs::Parse {
    int procFlag = 0;
    int pidFlag = 0;

    std::vector<HXLongOption> options() {
        return {{"all", false, nullptr, 'a'},
                {"json", true, nullptr, 'j'},
                {"help", false, nullptr, 'h'},
                {"targetChildren", false, nullptr, 't'},
                {"", true, nullptr, 'p'},
                {"proc", true, &procFlag, 1},
                {"exclude", true, nullptr, 'x'},
                {"pid", true, &pidFlag, 1},
                {"skip", false, nullptr, 's'},
                {"", false, nullptr, 'v'},
                {"format", true, nullptr, 'f'},
                {"sort", true, nullptr, sortOption},
                {"summary", false, nullptr, 'y'},
                {"physHeft", false, nullptr, physHeftOption},
                {"vmObjectDirty", false, nullptr, vmObjectDirtyOption},
                {"wide", false, nullptr, 'w'},
                {"swapped", false, nullptr, swappedOption},
                {"wired", false, nullptr, wiredOption},
                {"unmapped", false, nullptr, unmappedOption}};
    }
};

const std::vector<std::string> &HXHeftArgs::sortColumnNames() {
    static const std::vector<std::string> names = {"Dirty", "Swapped", "Clean",   "Reclaimable",
                                                   "Wired", "Regions", "Category"};
    return names;
}

std::unique_ptr<HXHeftArgs> HXHeftArgs::withArgc(int argc, char *const argv[], HXError *error) {
    if (error) *error = HXError();
    auto args = std::make_unique<HXHeftArgs>();
    Parse parse;
    const std::vector<HXLongOption> options = parse.options();
    HXOptionScan scan;
    for (bool restart = true;; restart = false) {
        scan = HXPlatform::current().services().getopt_long(argc, argv, kShortOptions, options, restart);
        if (scan.result == -1) break;
        if (!args->takeOption(scan.result, scan.argument, parse, error)) return nullptr;
    }
    args->reconcile();
    for (int i = scan.index; i < argc; i++)
        args->_potentialTargetProcesses.add(argv[i]);
    return args;
}

bool HXHeftArgs::takeOption(int option, const char *argument, Parse &parse, HXError *error) {
    switch (option) {
    case 'a':
        _targetAll = true;
        return true;
    case 'j':
        _JSONOutputFile = argument;
        return true;
    case 'h':
        setError(error, HXErrorHelp);
        return false;
    case 't':
        _targetChildren = true;
        return true;
    case 'p':
        _potentialTargetProcesses.add(argument);
        return true;
    case 'x':
        _excludedPidsOrProcesses.add(argument);
        return true;
    case 's':
        _skipIdleExitClean = true;
        return true;
    case 'v':
        _atlasLikeOutput = true;
        _summarize = false;
        return true;
    case 'f':
        return takeFormat(argument, error);
    case 'y':
        fputs("WARNING: -y/--summary options are deprecated because summary is the default mode\n", stderr);
        return true;
    case 'w':
        _textOptions |= HXTextWired | HXTextSwapped | HXTextWide;
        return true;
    case physHeftOption:
        fputs("WARNING: --physHeft option is deprecated because it is the default mode\n", stderr);
        return true;
    case vmObjectDirtyOption:
        _shouldGetPhysHeftBreakdown = false;
        _didSetShouldGetPhysHeftBreakdown = true;
        return true;
    case swappedOption:
        _textOptions |= HXTextSwapped;
        return true;
    case wiredOption:
        _textOptions |= HXTextWired;
        return true;
    case sortOption:
        return takeSort(argument, error);
    case unmappedOption:
        _searchForUnmapped = true;
        return true;
    case 0:
        if (parse.procFlag) {
            parse.procFlag = 0;
            _potentialTargetProcesses.add(argument);
        } else if (parse.pidFlag) {
            parse.pidFlag = 0;
            return takePid(argument, error);
        }
        return true;
    default:
        setError(error, HXErrorOption);
        return false;
    }
}

bool HXHeftArgs::takeFormat(const std::string &argument, HXError *error) {
    static const std::vector<std::string> formats = {"bytes", "formatted", "pages"};
    const auto found = std::find(formats.begin(), formats.end(), argument);
    if (found == formats.end()) {
        setError(
            error, HXErrorFormat,
            "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.");
        return false;
    }
    _summaryFormat = static_cast<int32_t>(found - formats.begin());
    return true;
}

bool HXHeftArgs::takeSort(const std::string &argument, HXError *error) {
    std::string accepted;
    for (const std::string &name : sortColumnNames()) {
        if (lowered(name) == lowered(argument)) {
            _textSort = name;
            return true;
        }
        accepted += (accepted.empty() ? "" : ", ") + lowered(name);
    }
    setError(error, HXErrorSort,
             "Unrecognized argument '" + argument + "' to --sort.\nAccepted arguments: " + accepted);
    return false;
}

bool HXHeftArgs::takePid(const std::string &argument, HXError *error) {
    char *end = nullptr;
    const long number = std::strtol(argument.c_str(), &end, 10);
    if (end == argument.c_str()) {
        setError(error, HXErrorPid,
                 "'" + argument +
                     "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a "
                     "process name.");
        return false;
    }
    _targetPids.set(static_cast<int32_t>(number), std::nullopt);
    return true;
}

void HXHeftArgs::reconcile() {
    if (!_shouldGetPhysHeftBreakdown && _searchForUnmapped) {
        fputs("WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
              "support "
              "unmapped owned VM objects\n",
              stderr);
        _searchForUnmapped = false;
    } else if (_targetAll && _searchForUnmapped) {
        fputs("NOTICE: '--unmapped' is redundant when using -a/--all\n", stderr);
        _searchForUnmapped = false;
    }
}
