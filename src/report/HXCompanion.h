// What the companions' command lines have in common.
#pragma once

#include "platform/HXServices.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// An option of a companion. `take` gets the argument ("" without one) and answers what is wrong with it;
// empty: nothing.
struct HXCompanionOption {
    const char *name;
    char letter; // zero: no short form
    bool hasArgument;
    std::function<std::string(const std::string &argument)> take;
};

// A companion's name and what it prints for --help.
struct HXCompanion {
    std::string name;
    std::string usage;

    // The words that are no options; none when the program is to end with *status: after --help and
    // --version, or when something is wrong, which is told on standard error; then it is `trouble`. At most
    // `mostWords`, at least `fewestWords`.
    std::optional<std::vector<std::string>> words(HXServices &services, int argc, char *const argv[],
                                                  const std::vector<HXCompanionOption> &options,
                                                  size_t fewestWords, size_t mostWords, int trouble,
                                                  int *status) const;
    // Tells on standard error what is wrong with `subject`.
    void complain(std::string_view subject, std::string_view problem) const;
    // Writes `text` to the file at `path`, which appears only when it is complete and is then for its owner
    // or for everybody to read, or to standard output when `path` is empty; false, told, when that fails.
    enum class Reader { owner, everybody };
    bool write(HXServices &services, const std::string &path, const std::string &text, Reader reader) const;
    // Flushes standard output; false, told, when something could not be written. A reader that went away is
    // no failure.
    bool finishOutput() const;
};

// A size as people write it: a number with at most one of the letters K, M, G and T (of 1024); none when it
// is none.
std::optional<uint64_t> HXParseSize(std::string_view text);
// A whole number of at most `most`, digits alone.
std::optional<uint64_t> HXParseCount(std::string_view text, uint64_t most);
// A size as people read it: at most six characters, as "812", "1.4K", "12.3M", "1023G".
std::string HXShortSize(uint64_t bytes);
// A change with its sign; "0" for none.
std::string HXShortChange(int64_t bytes);
