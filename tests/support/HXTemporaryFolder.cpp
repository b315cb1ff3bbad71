#include "support/HXTemporaryFolder.h"

#include <cstdlib>
#include <fstream>
#include <stdexcept>
#include <system_error>

namespace fs = std::filesystem;

HXTemporaryFolder::HXTemporaryFolder() {
    std::string name = fs::temp_directory_path() / "heft-tests-XXXXXX";
    if (::mkdtemp(name.data()) == nullptr) throw std::runtime_error("no temporary folder");
    _path = name;
    fs::permissions(_path, fs::perms(0755));
}

HXTemporaryFolder::~HXTemporaryFolder() {
    std::error_code ignored;
    fs::remove_all(_path, ignored);
}

void HXTemporaryFolder::write(const std::string &name, std::string_view text) const {
    fs::create_directories((_path / name).parent_path());
    std::ofstream(_path / name, std::ios::binary) << text;
}

void HXTemporaryFolder::link(const std::string &name, const std::string &target) const {
    fs::create_directories((_path / name).parent_path());
    fs::create_symlink(target, _path / name);
}

void HXTemporaryFolder::remove(const std::string &name) const {
    fs::remove_all(_path / name);
}
