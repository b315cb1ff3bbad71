#include "record/HXAnonymizer.h"

std::string HXAnonymizer::made(Names &names, char prefix, std::string_view name) {
    if (name.empty()) return {};
    auto found = names.find(name);
    if (found == names.end()) found = names.emplace(name, prefix + std::to_string(names.size() + 1)).first;
    return found->second;
}

std::string HXAnonymizer::path(std::string_view path) {
    constexpr std::string_view deleted = " (deleted)", systemV = "/SYSV", memfd = "/memfd:";
    if (path.ends_with(deleted))
        return this->path(path.substr(0, path.size() - deleted.size())) + std::string(deleted);
    if (path == "[vdso]") return std::string(path);
    if (path.starts_with(systemV))
        return std::string(systemV) + made(_segments, 'k', path.substr(systemV.size()));
    if (path.starts_with(memfd)) return std::string(memfd) + made(_files, 'f', path.substr(memfd.size()));
    std::string result;
    for (size_t slash; (slash = path.find('/')) != std::string_view::npos; path.remove_prefix(slash + 1))
        result += made(_directories, 'd', path.substr(0, slash)) + "/";
    return result + made(_files, 'f', path);
}
