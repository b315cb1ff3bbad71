// What a kind of capture file may hold: its record words and their fields, as tables that its reader and its
// writer share.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

enum class HXFieldKind : uint8_t {
    unsigned8,
    unsigned16,
    unsigned32,
    unsigned64,
    signed32,
    signed64,
    boolean,
    text,
};

enum class HXFieldNeed : uint8_t {
    required,
    optional,  // the field's absence has a meaning of its own
    defaulted, // absent, the field has the default value
};

struct HXFieldForm {
    std::string_view name;
    HXFieldKind kind;
    HXFieldNeed need;
    uint64_t defaultValue = 0; // signed values sign-extended

    static constexpr HXFieldForm required(std::string_view name, HXFieldKind kind) {
        return {name, kind, HXFieldNeed::required};
    }
    static constexpr HXFieldForm optional(std::string_view name, HXFieldKind kind) {
        return {name, kind, HXFieldNeed::optional};
    }
    // A text's default is always empty.
    static constexpr HXFieldForm defaulted(std::string_view name, HXFieldKind kind, uint64_t value = 0) {
        return {name, kind, HXFieldNeed::defaulted, value};
    }
};

struct HXRecordForm {
    std::string_view word;
    std::span<const HXFieldForm> fields; // at most kMaxCaptureFields
};

struct HXCaptureFormat {
    std::string_view header;        // the first line
    std::string_view headerProblem; // the reason given for any other first line
    std::span<const HXRecordForm> records;
};

inline constexpr size_t kMaxCaptureFields = 32;
inline constexpr size_t kMaxCaptureRecordBytes = 1 << 20; // without the newline
