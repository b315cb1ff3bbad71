// Made-up names for those in a capture that is to be shared.
#pragma once

#include <map>
#include <string>
#include <string_view>

// Gives every name a made-up one, numbered in the order in which the names come: the same name always
// becomes the same, different names become different. What kind of thing a path names stays visible:
// "/usr/lib/libfoo.so (deleted)" becomes "/d1/d2/f1 (deleted)", "[vdso]" stays.
class HXAnonymizer {
  public:
    // The path of a file, or what stands in a path's place for memory without a file.
    std::string path(std::string_view path);
    // The name of a program; it is the same as the last component of its path.
    std::string programName(std::string_view name) { return made(_files, 'f', name); }
    // A name that a program gives its memory.
    std::string memoryName(std::string_view name) { return made(_memory, 'n', name); }

  private:
    using Names = std::map<std::string, std::string, std::less<>>;
    static std::string made(Names &names, char prefix, std::string_view name);

    Names _directories, _files, _memory, _segments;
};
