// Strings that repeat across processes, kept once a run.
#pragma once

#include <string>
#include <string_view>

// A reference to an interned, immutable string, or none. Copying one copies a pointer; equal strings are the
// same string. The strings live as long as the run.
class HXString {
  public:
    HXString() = default;

    // The run's one string of that text. May be called from any thread.
    static HXString intern(std::string_view text);

    // Whether there is a string at all; an empty one is one.
    explicit operator bool() const { return _string != nullptr; }
    // The text; empty when there is no string.
    const std::string &str() const;
    const char *c_str() const { return str().c_str(); }
    bool isEmpty() const { return _string == nullptr || _string->empty(); }
    // The string's identity: null for none.
    const void *identity() const { return _string; }

    bool operator==(const HXString &other) const = default;

  private:
    friend class HXStringSlots;
    explicit HXString(const std::string *string) : _string(string) {}

    const std::string *_string = nullptr;
};
