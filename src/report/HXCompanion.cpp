#include "report/HXCompanion.h"

#include "platform/HXVersion.h"
#include "platform/linux/HXStandardOutput.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <system_error>

namespace {
constexpr std::string_view kUnits = "KMGT";
constexpr double kStep = 1024;
} // namespace

std::optional<std::vector<std::string>> HXCompanion::words(HXServices &services, int argc, char *const argv[],
                                                           const std::vector<HXCompanionOption> &options,
                                                           size_t fewestWords, size_t mostWords, int trouble,
                                                           int *status) const {
    constexpr int help = 'h';
    constexpr int version = 256, beyondLetters = 257;
    std::string letters = "h";
    std::vector<HXLongOption> longOptions = {{"help", false, help}, {"version", false, version}};
    const size_t ours = longOptions.size();
    for (const HXCompanionOption &option : options) {
        if (option.letter) letters += std::string(1, option.letter) + (option.hasArgument ? ":" : "");
        const int value =
            option.letter ? option.letter : beyondLetters + static_cast<int>(longOptions.size());
        longOptions.push_back({option.name, option.hasArgument, value});
    }
    *status = trouble;
    HXOptionScan scan;
    for (bool restart = true;; restart = false) {
        scan = services.getopt_long(argc, argv, letters.c_str(), longOptions, restart);
        if (scan.result == -1) break;
        if (scan.result == help || scan.result == version) {
            const std::string line = name + " " + kHXVersion + "\n";
            std::fputs(scan.result == help ? usage.c_str() : line.c_str(), stdout);
            *status = finishOutput() ? 0 : trouble;
            return std::nullopt;
        }
        const auto found = std::ranges::find(longOptions, scan.result, &HXLongOption::value);
        if (found == longOptions.end()) {
            std::fputs(usage.c_str(), stderr);
            return std::nullopt;
        }
        const HXCompanionOption &option = options[static_cast<size_t>(found - longOptions.begin()) - ours];
        const std::string problem = option.take(scan.argument ? scan.argument : "");
        if (problem.empty()) continue;
        complain(std::string("--") + option.name, problem);
        return std::nullopt;
    }
    std::vector<std::string> words(argv + scan.index, argv + argc);
    if (words.size() >= fewestWords && words.size() <= mostWords) return words;
    std::fputs(usage.c_str(), stderr);
    return std::nullopt;
}

void HXCompanion::complain(std::string_view subject, std::string_view problem) const {
    std::fprintf(stderr, "%s: %.*s: %.*s\n", name.c_str(), static_cast<int>(subject.size()), subject.data(),
                 static_cast<int>(problem.size()), problem.data());
}

bool HXCompanion::write(HXServices &services, const std::string &path, const std::string &text,
                        Reader reader) const {
    namespace fs = std::filesystem;
    if (path.empty()) {
        std::fwrite(text.data(), 1, text.size(), stdout);
        return finishOutput();
    }
    auto file = services.createPendingFile(path);
    if (!file) {
        complain(path, std::strerror(errno));
        return false;
    }
    // Beside its place it is its owner's alone.
    std::error_code error;
    constexpr auto readable =
        fs::perms::owner_read | fs::perms::owner_write | fs::perms::group_read | fs::perms::others_read;
    if (reader == Reader::everybody && !file->temporaryPath.empty())
        fs::permissions(file->temporaryPath, readable, error);
    std::fwrite(text.data(), 1, text.size(), file->stream);
    if (!error && services.commitPendingFile(*file)) return true;
    complain(path, error ? error.message() : std::strerror(errno));
    services.discardPendingFile(*file);
    return false;
}

bool HXCompanion::finishOutput() const {
    const int failure = HXFlushStandardOutput();
    if (failure == 0 || failure == EPIPE) return true;
    complain("standard output", std::strerror(failure));
    return false;
}

std::optional<uint64_t> HXParseCount(std::string_view text, uint64_t most) {
    uint64_t count = 0;
    const char *const end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, count);
    if (error != std::errc() || stop != end || count > most) return std::nullopt;
    return count;
}

std::optional<uint64_t> HXParseSize(std::string_view text) {
    double factor = 1;
    const size_t unit = text.empty() ? std::string_view::npos : kUnits.find(text.back());
    if (unit != std::string_view::npos) {
        factor = std::pow(kStep, static_cast<double>(unit + 1));
        text.remove_suffix(1);
    }
    double number = 0;
    const char *const end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, number, std::chars_format::fixed);
    constexpr double most = 9e18;
    if (error != std::errc() || stop != end || !(number >= 0) || number * factor > most) return std::nullopt;
    return static_cast<uint64_t>(number * factor);
}

std::string HXShortSize(uint64_t bytes) {
    if (bytes < 1024) return std::to_string(bytes);
    double number = static_cast<double>(bytes);
    size_t unit = 0;
    for (number /= kStep; number >= kStep - 0.5 && unit + 1 < kUnits.size(); number /= kStep)
        unit++;
    char text[32];
    std::snprintf(text, sizeof text, number < 99.95 ? "%.1f%c" : "%.0f%c", number, kUnits[unit]);
    return text;
}

std::string HXShortChange(int64_t bytes) {
    if (bytes == 0) return "0";
    const uint64_t size = bytes < 0 ? 0 - static_cast<uint64_t>(bytes) : static_cast<uint64_t>(bytes);
    return (bytes < 0 ? "-" : "+") + HXShortSize(size);
}
