// Tables of test cases, kept as files in tests/cases.
//
//   What the file is about: all that comes before the first case.
//   == TITLE
//   the lines of the input
//   -- LABEL
//   the lines that are expected; any number of such parts, with a label or without
//
// Blank lines at the end of a part are no part of it. A table whose rows take a line each has no "--": they
// read "QUESTION => ANSWER", with blank lines and comments ("#") between them.
#pragma once

#include <functional>
#include <string>
#include <vector>

struct HXCase {
    struct Part {
        std::string label;
        std::string text;
    };
    std::string title;
    std::string input; // every line with its line end, as in the parts
    std::vector<Part> expected;
};

// The cases of a file in tests/cases; fails the test when there are none.
std::vector<HXCase> HXReadCases(const std::string &name);

// `rows` with the answers that `answer` gives to their questions: equal to `rows` when all are right.
std::string HXAnswered(const std::string &rows,
                       const std::function<std::string(const std::string &question)> &answer);

std::vector<std::string> HXLinesOf(const std::string &text);
// What is between blanks, or between double quotes.
std::vector<std::string> HXWordsOf(const std::string &text);
