#include "support/HXBuilders.h"

#include "support/HXTemporaryFolder.h"

#include <unistd.h>

namespace {
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
        return contentOf(_file);
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
    return {out.finish(), err.finish()};
}

std::string contentOf(std::FILE *file) {
    std::string content;
    std::rewind(file);
    char part[65536];
    while (const size_t length = std::fread(part, 1, sizeof part, file))
        content.append(part, length);
    std::fclose(file);
    return content;
}

std::string contentOf(const std::string &path) {
    std::FILE *file = std::fopen(path.c_str(), "r");
    return file ? contentOf(file) : "";
}

std::string temporaryPath() {
    static HXTemporaryFolder folder;
    static int count = 0;
    return folder / std::to_string(++count);
}
