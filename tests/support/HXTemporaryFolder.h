// A folder of a test's own, removed with all that is in it.
#pragma once

#include <filesystem>
#include <string>
#include <string_view>

class HXTemporaryFolder {
  public:
    // Readable by everybody, so that a test can also look at it as another user.
    HXTemporaryFolder();
    ~HXTemporaryFolder();
    HXTemporaryFolder(const HXTemporaryFolder &) = delete;
    HXTemporaryFolder &operator=(const HXTemporaryFolder &) = delete;

    const std::filesystem::path &path() const { return _path; }
    std::filesystem::path operator/(const std::string &name) const { return _path / name; }
    // Writes a file, and makes the folders that lead to it.
    void write(const std::string &name, std::string_view text) const;
    // Makes a symbolic link, and the folders that lead to it.
    void link(const std::string &name, const std::string &target) const;
    void remove(const std::string &name) const;

  private:
    std::filesystem::path _path;
};
