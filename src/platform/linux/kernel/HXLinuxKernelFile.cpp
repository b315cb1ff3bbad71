#include "platform/linux/kernel/HXLinuxKernelFile.h"

#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

std::optional<std::string> HXReadKernelFile(const std::string &path, int *error) {
    const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY);
    if (file < 0) {
        *error = errno;
        return std::nullopt;
    }
    std::string content;
    size_t filled = 0;
    ssize_t count = 0;
    do {
        // The kernel makes such a file up in pieces of a page or more, whatever the room.
        if (content.size() - filled < 4096)
            content.resize(content.size() < 4096 ? 16384 : content.size() * 2);
        count = read(file, content.data() + filled, content.size() - filled);
        if (count > 0) filled += static_cast<size_t>(count);
    } while (count > 0 || (count < 0 && errno == EINTR));
    *error = count < 0 ? errno : 0;
    close(file);
    if (count < 0) return std::nullopt;
    content.resize(filled);
    return content;
}

std::string HXReadKernelFile(const std::string &path) {
    int error = 0;
    return HXReadKernelFile(path, &error).value_or(std::string());
}
