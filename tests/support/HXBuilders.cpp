#include "support/HXBuilders.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <unistd.h>

namespace {
// A directory of this run's files.
struct Scratch {
    std::string path;
    Scratch() {
        std::string name = std::filesystem::temp_directory_path() / "heft-tests-XXXXXX";
        path = ::mkdtemp(name.data());
    }
    ~Scratch() {
        std::error_code ignored;
        std::filesystem::remove_all(path, ignored);
    }
};

// Points a descriptor at a file until it is destroyed.
class Redirection {
  public:
    Redirection(int descriptor, std::FILE *stream)
        : _descriptor(descriptor), _stream(stream), _saved(::dup(descriptor)), _file(std::tmpfile()) {
        std::fflush(stream);
        ::dup2(::fileno(_file), descriptor);
    }
    std::string finish() {
        std::fflush(_stream);
        ::dup2(_saved, _descriptor);
        ::close(_saved);
        std::string text;
        std::rewind(_file);
        char part[65536];
        while (const size_t length = std::fread(part, 1, sizeof part, _file))
            text.append(part, length);
        std::fclose(_file);
        return text;
    }

  private:
    int _descriptor;
    std::FILE *_stream;
    int _saved;
    std::FILE *_file;
};
} // namespace

HXPrinted printedBy(const std::function<void()> &work) {
    Redirection out(1, stdout);
    Redirection err(2, stderr);
    work();
    HXPrinted printed;
    printed.err = err.finish();
    printed.out = out.finish();
    return printed;
}

std::string contentOf(const std::string &path) {
    std::ifstream file(path, std::ios::binary);
    std::ostringstream text;
    text << file.rdbuf();
    return text.str();
}

std::string temporaryPath() {
    static Scratch scratch;
    static int count = 0;
    return scratch.path + "/" + std::to_string(++count);
}
