#include "platform/linux/HXProcessPlaces.h"

#include "platform/HXSafeText.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <vector>

namespace {

// How engines call the control group of a container: what stands before and after its name. What else begins
// so is an engine's own process.
struct ContainerForm {
    std::string_view prefix;
    std::string_view suffix;
    std::string_view kind;
    bool isHexadecimal; // the name is an identifier
};
constexpr ContainerForm kContainerForms[] = {
    {"docker-", ".scope", "docker", true},
    {"libpod-", ".scope", "podman", true},
    {"libpod-", "", "podman", true},
    {"cri-containerd-", ".scope", "containerd", true},
    {"nerdctl-", ".scope", "containerd", true},
    {"crio-", ".scope", "crio", true},
    {"crio-", "", "crio", true},
    {"lxc.payload.", "", "lxc", false},
    {"systemd-nspawn@", ".service", "nspawn", false},
    {"machine-", ".scope", "machine", false},
};
// Groups under which each group is a container.
struct ContainerParent {
    std::string_view name;
    std::string_view kind;
    bool isHexadecimal;
};
constexpr ContainerParent kContainerParents[] = {
    {"docker", "docker", true},    {"libpod_parent", "podman", true}, {"lxc", "lxc", false},
    {"lxc.payload", "lxc", false}, {"default", "containerd", true},
};
constexpr size_t kIdentifierLength = 64;
constexpr size_t kShortIdentifierLength = 12;

bool isIdentifier(std::string_view text) {
    return text.size() == kIdentifierLength &&
           text.find_first_not_of("0123456789abcdef") == std::string_view::npos;
}

// The name of a unit, with an identifier in it cut.
std::string unitName(std::string_view group) {
    const size_t dot = group.rfind('.');
    const size_t start = group.rfind('-', dot) + 1; // 0 where there is none
    if (!isIdentifier(group.substr(start, dot - start))) return HXSafeName(group);
    return HXSafeName(group.substr(0, start + kShortIdentifierLength)) + HXSafeName(group.substr(dot));
}

std::string containerName(std::string_view kind, std::string_view name) {
    if (isIdentifier(name)) name = name.substr(0, kShortIdentifierLength);
    return std::string(kind) + ':' + HXSafeName(name);
}

// The container that a group is, given the groups above it; empty when it is none.
std::string containerAt(std::string_view group, std::string_view parent, bool isInPod) {
    for (const ContainerForm &form : kContainerForms) {
        if (!group.starts_with(form.prefix) || !group.ends_with(form.suffix) ||
            group.size() <= form.prefix.size() + form.suffix.size())
            continue;
        const std::string_view name =
            group.substr(form.prefix.size(), group.size() - form.prefix.size() - form.suffix.size());
        if (!form.isHexadecimal || isIdentifier(name)) return containerName(form.kind, name);
    }
    for (const ContainerParent &form : kContainerParents)
        if (parent == form.name && (!form.isHexadecimal || isIdentifier(group)))
            return containerName(form.kind, group);
    return isInPod && isIdentifier(group) ? containerName("pod", group) : std::string();
}

std::optional<uint64_t> readSize(const std::string &path) {
    char buffer[32];
    const auto text = HXReadOnce(AT_FDCWD, path.c_str(), buffer);
    uint64_t size = 0;
    if (!text || std::from_chars(text->data(), text->data() + text->size(), size).ec != std::errc())
        return std::nullopt;
    return size;
}

} // namespace

HXGroupNames HXNamesOnPath(std::string_view path) {
    HXGroupNames names;
    std::string_view parent;
    bool isInPod = false;
    for (size_t start = 0; start < path.size();) {
        const size_t end = std::min(path.find('/', start), path.size());
        const std::string_view group = path.substr(start, end - start);
        const std::string here(path.substr(0, end));
        if (names.container.name.empty()) {
            names.container.name = containerAt(group, parent, isInPod);
            if (!names.container.name.empty()) names.container.path = here;
        }
        if (group.ends_with(".service") || group.ends_with(".scope")) {
            const bool isInside = !names.container.name.empty() && names.container.path != here;
            names.unit = {(isInside ? names.container.name + '/' : std::string()) + unitName(group), here};
        }
        isInPod = isInPod || group.starts_with("kubepods");
        parent = group;
        start = end + 1;
    }
    return names;
}

HXGroupPaths HXParseGroups(std::string_view text) {
    HXGroupPaths paths;
    for (size_t start = 0; start < text.size();) {
        const size_t end = std::min(text.find('\n', start), text.size());
        const std::string_view line = text.substr(start, end - start);
        start = end + 1;
        // NUMBER:CONTROLLERS:PATH
        const size_t first = line.find(':');
        const size_t second = first == std::string_view::npos ? first : line.find(':', first + 1);
        if (second == std::string_view::npos) continue;
        const std::string controllers = ',' + std::string(line.substr(first + 1, second - first - 1)) + ',';
        const std::string path(line.substr(second + 1));
        if (line.starts_with("0::"))
            paths.unified = path;
        else if (controllers == ",name=systemd,")
            paths.systemd = path;
        else if (controllers.find(",memory,") != std::string::npos)
            paths.memory = path;
    }
    return paths;
}

std::optional<uint32_t> HXParseUser(std::string_view status) {
    constexpr std::string_view label = "\nUid:\t"; // real, effective, saved, of the file system
    size_t at = status.find(label);
    if (at == std::string_view::npos) return std::nullopt;
    at = status.find('\t', at + label.size());
    uint32_t user = 0;
    if (at == std::string_view::npos ||
        std::from_chars(status.data() + at + 1, status.data() + status.size(), user).ec != std::errc())
        return std::nullopt;
    return user;
}

const std::string &HXProcessPlaces::nameOfUser(uint32_t user) {
    const auto [found, isNew] = _users.try_emplace(user);
    if (isNew) {
        constexpr size_t enough = 16384;
        std::vector<char> buffer(enough);
        passwd entry;
        passwd *result = nullptr;
        const bool isNamed =
            ::getpwuid_r(user, &entry, buffer.data(), buffer.size(), &result) == 0 && result != nullptr;
        found->second = isNamed ? HXSafeName(result->pw_name) : std::to_string(user);
    }
    return found->second;
}

std::optional<HXProcessPlaces::Place> HXProcessPlaces::placeOf(int32_t pid) {
    const std::string folder = _procPath + '/' + std::to_string(pid);
    const auto status = HXReadText(AT_FDCWD, (folder + "/status").c_str());
    const auto user = status ? HXParseUser(*status) : std::nullopt;
    if (!user) return std::nullopt;
    Place place;
    place.user = nameOfUser(*user);
    const auto text = HXReadText(AT_FDCWD, (folder + "/cgroup").c_str());
    const HXGroupPaths paths = HXParseGroups(text.value_or(""));
    place.memoryGroups = HXNamesOnPath(paths.memory);
    // The first hierarchy in which the process is anywhere.
    for (const std::string *path : {&paths.unified, &paths.systemd, &paths.memory}) {
        if (path->size() <= 1) continue;
        place.groups = HXNamesOnPath(*path);
        break;
    }
    return place;
}

std::optional<uint64_t> HXProcessPlaces::memoryOf(const std::string &unified,
                                                  const std::string &memory) const {
    if (!unified.empty()) {
        for (const char *mount : {"", "/unified"})
            if (const auto size = readSize(_groupPath + mount + unified + "/memory.current")) return size;
    }
    if (memory.empty()) return std::nullopt;
    return readSize(_groupPath + "/memory" + memory + "/memory.usage_in_bytes");
}
