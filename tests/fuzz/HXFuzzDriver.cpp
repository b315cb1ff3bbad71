// Runs a fuzz target without a fuzzing engine: over the files of its corpus, then over mutations of them, the
// same in every run, for HEFT_FUZZ_SECONDS (default 2).
#include <algorithm>
#include <chrono>
#include <csignal>
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

std::string current;

// The input that a target could not take, so that it can be tried again and kept in the corpus.
void tellInput(int) {
    for (const char character : current)
        std::fprintf(stderr,
                     character == '\n'                                         ? "%c"
                     : character < ' ' || character > '~' || character == '\\' ? "\\x%02x"
                                                                               : "%c",
                     static_cast<unsigned char>(character));
    std::fputc('\n', stderr);
}

void run(const std::string &input) {
    current = input;
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

// Inputs, and the lines, fields and numbers that mutations are made of.
struct Corpus {
    std::vector<std::string> inputs, lines;
    std::vector<std::string> words = {"0",
                                      "-1",
                                      "0x",
                                      "4096",
                                      "65535",
                                      "2147483648",
                                      "18446744073709551615",
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
                                      "#"};

    explicit Corpus(const std::string &folder) {
        std::set<std::filesystem::path> paths; // in an order that does not depend on the file system
        for (const auto &entry : std::filesystem::directory_iterator(folder))
            paths.insert(entry.path());
        for (const auto &path : paths) {
            std::ifstream file(path, std::ios::binary);
            inputs.emplace_back(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
            for (std::string &word : split(inputs.back(), "\t\n"))
                words.push_back("\t" + std::move(word));
            for (std::string &line : split(inputs.back(), "\n"))
                lines.push_back(std::move(line));
        }
    }
};

void mutate(const Corpus &corpus, std::string &input) {
    const size_t place = below(input.size() + 1);
    const size_t lineEnd = input.find('\n', place), number = input.find('=', place);
    const std::string &word = corpus.words[below(corpus.words.size())];
    const size_t choice = below(25);
    if (choice == 0) // truncated
        input.resize(place);
    else if (choice <= 4 && place < input.size()) // another byte
        input[place] = static_cast<char>(below(256));
    else if (choice <= 8) // something less
        input.erase(place, 1 + below(16));
    else if (choice <= 16 && lineEnd != std::string::npos) // a line more, or in the next line's place
        input.replace(lineEnd + 1, below(2) == 0 ? 0 : input.find('\n', lineEnd + 1) - lineEnd,
                      corpus.lines[below(corpus.lines.size())] + "\n");
    else if (choice <= 20 || number == std::string::npos) // a word more
        input.insert(place, word);
    else // a word in place of a number
        input.replace(number + 1, std::min(input.find_first_of("\t\n", number), input.size()) - number - 1,
                      word);
}

} // namespace

int main(int argc, char *argv[]) {
    if (argc != 2) return 2;
    std::signal(SIGABRT, tellInput);
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
            mutate(corpus, input);
        run(input);
    }
    std::printf("%zu inputs and %zu mutations\n", corpus.inputs.size(), runs);
    return 0;
}
