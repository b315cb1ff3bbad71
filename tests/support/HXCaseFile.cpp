#include "support/HXCaseFile.h"

#include "support/HXBuilders.h"

#include <gtest/gtest.h>
#include <iomanip>
#include <sstream>

namespace {
void dropLastBlankLines(std::string &text) {
    while (text == "\n" || text.ends_with("\n\n"))
        text.pop_back();
}
} // namespace

std::vector<HXCase> HXReadCases(const std::string &name) {
    std::vector<HXCase> cases;
    std::string *part = nullptr;
    for (const std::string &line : HXLinesOf(contentOf(TEST_CASES "/" + name))) {
        if (line.starts_with("== ")) {
            part = &cases.emplace_back(HXCase{line.substr(3), {}, {}}).input;
        } else if (part && (line == "--" || line.starts_with("-- "))) {
            const std::string label = line.size() > 3 ? line.substr(3) : "";
            part = &cases.back().expected.emplace_back(HXCase::Part{label, {}}).text;
        } else if (part) {
            *part += line + "\n";
        }
    }
    for (HXCase &each : cases) {
        dropLastBlankLines(each.input);
        for (HXCase::Part &expected : each.expected)
            dropLastBlankLines(expected.text);
    }
    EXPECT_FALSE(cases.empty()) << name;
    return cases;
}

std::string HXAnswered(const std::string &rows,
                       const std::function<std::string(const std::string &)> &answer) {
    std::string text;
    for (const std::string &row : HXLinesOf(rows)) {
        if (row.empty() || row.starts_with('#')) {
            text += row + "\n";
            continue;
        }
        const std::string question = row.substr(0, row.rfind("=>"));
        const std::string said = answer(question.substr(0, question.find_last_not_of(' ') + 1));
        text += question + (said.empty() ? "=>" : "=> " + said) + "\n";
    }
    return text;
}

std::vector<std::string> HXLinesOf(const std::string &text) {
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);)
        lines.push_back(line);
    return lines;
}

std::vector<std::string> HXWordsOf(const std::string &text) {
    std::vector<std::string> words;
    std::istringstream stream(text);
    for (std::string word; stream >> std::quoted(word);)
        words.push_back(word);
    return words;
}
