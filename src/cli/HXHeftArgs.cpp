// The command line.
#include "cli/HXHeftArgs.h"

#include "output/HXOutputFormatterText.h"
#include "platform/HXPlatform.h"

#include <algorithm>
#include <cctype>
#include <cstdlib>

namespace {

std::string lowered(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](char c) { return static_cast<char>(std::tolower(static_cast<unsigned char>(c))); });
    return text;
}

} // namespace

void HXStringSet::add(const std::string &text) {
    if (std::find(_strings.begin(), _strings.end(), text) == _strings.end()) _strings.push_back(text);
}

void HXStringSet::remove(const std::string &text) {
    std::erase(_strings, text);
}

// One option, and what of it there is to do.
struct HXHeftArgs::Option {
    const char *name = ""; // empty: no long form
    char letter = '\0';    // zero: no short form
    bool hasArgument = false;
    int32_t columns = 0;                                    // HXTextOptions to add
    bool HXHeftArgs::*set = nullptr;                        // becomes true
    std::optional<std::string> HXHeftArgs::*text = nullptr; // becomes the argument
    HXStringSet HXHeftArgs::*list = nullptr;                // gets the argument
    const char *warning = nullptr;                          // goes to standard error
    bool (HXHeftArgs::*take)(const std::string &argument, HXError *error) = nullptr;

    static const Option all[19];
};

const HXHeftArgs::Option HXHeftArgs::Option::all[] = {
    {.name = "all", .letter = 'a', .set = &HXHeftArgs::_targetAll},
    {.name = "json", .letter = 'j', .hasArgument = true, .text = &HXHeftArgs::_JSONOutputFile},
    {.name = "help", .letter = 'h', .take = &HXHeftArgs::takeHelp},
    {.name = "targetChildren", .letter = 't', .set = &HXHeftArgs::_targetChildren},
    {.letter = 'p', .hasArgument = true, .list = &HXHeftArgs::_potentialTargetProcesses},
    {.name = "proc", .hasArgument = true, .list = &HXHeftArgs::_potentialTargetProcesses},
    {.name = "exclude", .letter = 'x', .hasArgument = true, .list = &HXHeftArgs::_excludedPidsOrProcesses},
    {.name = "pid", .hasArgument = true, .take = &HXHeftArgs::takePid},
    {.name = "skip", .letter = 's', .set = &HXHeftArgs::_skipIdleExitClean},
    {.letter = 'v', .set = &HXHeftArgs::_atlasLikeOutput},
    {.name = "format", .letter = 'f', .hasArgument = true, .take = &HXHeftArgs::takeFormat},
    {.name = "sort", .hasArgument = true, .take = &HXHeftArgs::takeSort},
    {.name = "summary",
     .letter = 'y',
     .warning = "WARNING: -y/--summary options are deprecated because summary is the default mode\n"},
    {.name = "physHeft",
     .warning = "WARNING: --physHeft option is deprecated because it is the default mode\n"},
    {.name = "vmObjectDirty", .take = &HXHeftArgs::takeVmObjectDirty},
    {.name = "wide", .letter = 'w', .columns = HXTextWired | HXTextSwapped | HXTextWide},
    {.name = "swapped", .columns = HXTextSwapped},
    {.name = "wired", .columns = HXTextWired},
    {.name = "unmapped", .set = &HXHeftArgs::_searchForUnmapped},
};

const std::vector<std::string> &HXHeftArgs::sortColumnNames() {
    static const std::vector<std::string> names = {"Dirty", "Swapped", "Clean",   "Reclaimable",
                                                   "Wired", "Regions", "Category"};
    return names;
}

std::unique_ptr<HXHeftArgs> HXHeftArgs::withArgc(int argc, char *const argv[], HXError *error) {
    constexpr int beyondLetters = 256; // the first value of options that have no letter
    if (error) *error = HXError();
    std::string letters;
    std::vector<HXLongOption> words;
    for (const Option &option : Option::all) {
        const int position = static_cast<int>(words.size());
        if (option.letter) letters += std::string(1, option.letter) + (option.hasArgument ? ":" : "");
        words.push_back(
            {option.name, option.hasArgument, option.letter ? option.letter : beyondLetters + position});
    }
    auto args = std::make_unique<HXHeftArgs>();
    HXOptionScan scan;
    for (bool restart = true;; restart = false) {
        scan = HXPlatform::current().services().getopt_long(argc, argv, letters.c_str(), words, restart);
        if (scan.result == -1) break;
        const auto word = std::find_if(words.begin(), words.end(),
                                       [&](const HXLongOption &each) { return each.value == scan.result; });
        if (word == words.end()) {
            fail(error, HXErrorOption);
            return nullptr;
        }
        if (!args->take(Option::all[word - words.begin()], scan.argument, error)) return nullptr;
    }
    args->reconcile();
    for (int i = scan.index; i < argc; i++)
        args->_potentialTargetProcesses.add(argv[i]);
    return args;
}

bool HXHeftArgs::fail(HXError *error, HXHeftErrorCode code, std::optional<std::string> description) {
    if (error) *error = HXError(HXHeftError, code, std::move(description));
    return false;
}

bool HXHeftArgs::take(const Option &option, const char *argument, HXError *error) {
    if (option.set) this->*option.set = true;
    if (option.text) this->*option.text = argument;
    if (option.list) (this->*option.list).add(argument);
    if (option.warning) fputs(option.warning, stderr);
    _textOptions |= option.columns;
    return !option.take || (this->*option.take)(argument ? argument : "", error);
}

bool HXHeftArgs::takeHelp(const std::string &, HXError *error) {
    return fail(error, HXErrorHelp);
}

bool HXHeftArgs::takeVmObjectDirty(const std::string &, HXError *) {
    _shouldGetPhysHeftBreakdown = false;
    _didSetShouldGetPhysHeftBreakdown = true;
    return true;
}

bool HXHeftArgs::takeFormat(const std::string &argument, HXError *error) {
    static const std::vector<std::string> formats = {"bytes", "formatted", "pages"};
    const auto found = std::find(formats.begin(), formats.end(), argument);
    if (found == formats.end()) {
        return fail(
            error, HXErrorFormat,
            "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.");
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
    return fail(error, HXErrorSort,
                "Unrecognized argument '" + argument + "' to --sort.\nAccepted arguments: " + accepted);
}

bool HXHeftArgs::takePid(const std::string &argument, HXError *error) {
    char *end = nullptr;
    const long number = std::strtol(argument.c_str(), &end, 10);
    if (end == argument.c_str()) {
        return fail(error, HXErrorPid,
                    "'" + argument +
                        "' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a "
                        "process name.");
    }
    _targetPids.set(static_cast<int32_t>(number), std::nullopt);
    return true;
}

void HXHeftArgs::reconcile() {
    if (!_shouldGetPhysHeftBreakdown && _searchForUnmapped) {
        fputs("WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
              "support unmapped owned VM objects\n",
              stderr);
        _searchForUnmapped = false;
    } else if (_targetAll && _searchForUnmapped) {
        fputs("NOTICE: '--unmapped' is redundant when using -a/--all\n", stderr);
        _searchForUnmapped = false;
    }
}
