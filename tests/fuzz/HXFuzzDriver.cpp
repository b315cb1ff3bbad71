// Runs a fuzz target without a fuzzing engine: over the files of its corpus, then over mutations of them, the
// same in every run, for HEFT_FUZZ_SECONDS (default 2).
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <set>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

namespace {

std::mt19937_64 randomness(1);

size_t below(size_t limit) {
    return limit == 0 ? 0 : randomness() % limit;
}

void run(const std::string &input) {
    LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(input.data()), input.size());
}

std::vector<std::string> split(const std::string &text, const char *separators) {
    std::vector<std::string> parts;
    for (size_t start = 0; start < text.size();) {
        const size_t end = std::min(text.find_first_of(separators, start), text.size());
        parts.push_back(text.substr(start, end - start));
        start = end + 1;
    }
    return parts;
}

// Inputs, and the fields and numbers that mutations are made of.
struct Corpus {
    std::vector<std::string> inputs;
    std::vector<std::string> words = {
        "0",
        "1",
        "-1",
        "0x",
        "4096",
        "65535",
        "2147483648",
        "4294967296",
        "18446744073709551615",
        "0xffffffffffffffff",
        "0xfffffffffffff000",
        "144115188075855872",
        "\\t",
        "\\",
        "\t",
        "\n",
        "=",
        "1*1,",
        "18446744073709551615*1",
        std::string(1, '\0'),
        "\xff",
        "#",
    };

    explicit Corpus(const std::string &folder) {
        std::set<std::filesystem::path> paths; // in an order that does not depend on the file system
        for (const auto &entry : std::filesystem::directory_iterator(folder))
            paths.insert(entry.path());
        for (const auto &path : paths) {
            std::ifstream file(path, std::ios::binary);
            inputs.emplace_back(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
            for (std::string &word : split(inputs.back(), "\t\n"))
                words.push_back("\t" + std::move(word));
        }
    }
};

void mutateBytes(const Corpus &corpus, std::string &input) {
    const size_t place = below(input.size() + 1);
    switch (below(4)) {
    case 0: // another byte
        if (place < input.size()) input[place] = static_cast<char>(below(256));
        break;
    case 1: // something less
        input.erase(place, 1 + below(16));
        break;
    case 2: // truncated
        if (below(8) == 0) input.resize(place);
        break;
    default: // a word more, or in place of a number
        const std::string &word = corpus.words[below(corpus.words.size())];
        const size_t number = input.find('=', place);
        if (number != std::string::npos && below(2) == 0)
            input.replace(number + 1,
                          std::min(input.find_first_of("\t\n", number), input.size()) - number - 1, word);
        else
            input.insert(place, word);
    }
}

void mutateLines(const Corpus &corpus, std::string &input) {
    std::vector<std::string> lines = split(input, "\n");
    if (lines.size() < 2) return;
    const size_t from = 1 + below(lines.size() - 1), to = 1 + below(lines.size() - 1);
    switch (below(3)) {
    case 0: // a line twice
        lines.insert(lines.begin() + static_cast<std::ptrdiff_t>(to), lines[from]);
        break;
    case 1: // two lines in each other's place
        std::swap(lines[from], lines[to]);
        break;
    default: // a line of another input
        const auto others = split(corpus.inputs[below(corpus.inputs.size())], "\n");
        if (!others.empty()) lines[to] = others[below(others.size())];
    }
    input.clear();
    for (const std::string &line : lines)
        input += line + "\n";
}

} // namespace

int main(int argc, char *argv[]) {
    if (argc != 2) return 2;
    const Corpus corpus(argv[1]);
    if (corpus.inputs.empty()) return 2;
    for (const std::string &input : corpus.inputs)
        run(input);
    const char *const setting = std::getenv("HEFT_FUZZ_SECONDS");
    const auto end =
        std::chrono::steady_clock::now() + std::chrono::seconds(setting ? std::atoi(setting) : 2);
    size_t runs = 0;
    for (; std::chrono::steady_clock::now() < end; runs++) {
        std::string input = corpus.inputs[below(corpus.inputs.size())];
        for (size_t i = below(4); i < 4; i++)
            below(3) == 0 ? mutateLines(corpus, input) : mutateBytes(corpus, input);
        run(input);
    }
    std::printf("%zu inputs and %zu mutations\n", corpus.inputs.size(), runs);
    return 0;
}
