// What a kind of capture file may hold: its record words and their fields, as tables that its reader and its
// writer share.
#pragma once

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <cstring>
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

// A member that holds a number, of a record that the reader fills and the writer writes; or, made from a kind
// alone, none. Read and written bytewise: the host's records are packed.
struct HXMember {
    HXFieldKind kind = HXFieldKind::text;
    uint16_t offset = kNone;

    static constexpr uint16_t kNone = UINT16_MAX;

    constexpr HXMember() = default;
    // Not explicit: a field that has no place is given by its kind.
    constexpr HXMember(HXFieldKind ofKind) : kind(ofKind) {}
    template <class Number>
    static constexpr HXMember at(size_t offset) {
        HXMember member(kindOf<Number>());
        member.offset = static_cast<uint16_t>(offset);
        return member;
    }

    constexpr bool exists() const { return offset != kNone; }
    // The number, sign-extended.
    uint64_t of(const void *record) const {
        return withType([&](auto number) {
            std::memcpy(&number, static_cast<const char *>(record) + offset, sizeof number);
            return static_cast<uint64_t>(number);
        });
    }
    // Stores as much of `value` as the member has bits.
    void set(void *record, uint64_t value) const {
        withType([&](auto number) {
            number = static_cast<decltype(number)>(value);
            std::memcpy(static_cast<char *>(record) + offset, &number, sizeof number);
            return uint64_t{0};
        });
    }

  private:
    template <class Number>
    static constexpr HXFieldKind kindOf() {
        using Kind = HXFieldKind;
        if (std::same_as<Number, bool>) return Kind::boolean;
        if (std::signed_integral<Number>) return sizeof(Number) == 4 ? Kind::signed32 : Kind::signed64;
        return sizeof(Number) == 1   ? Kind::unsigned8
               : sizeof(Number) == 2 ? Kind::unsigned16
               : sizeof(Number) == 4 ? Kind::unsigned32
                                     : Kind::unsigned64;
    }
    template <class Work>
    uint64_t withType(Work work) const {
        switch (kind) {
        case HXFieldKind::unsigned8:
            return work(uint8_t{});
        case HXFieldKind::unsigned16:
            return work(uint16_t{});
        case HXFieldKind::unsigned32:
            return work(uint32_t{});
        case HXFieldKind::signed32:
            return work(int32_t{});
        case HXFieldKind::boolean:
            return work(bool{});
        default:
            return work(uint64_t{});
        }
    }
};

#define HX_MEMBER(Record, member) HXMember::at<decltype(Record::member)>(offsetof(Record, member))

enum class HXFieldNeed : uint8_t {
    required,
    optional,  // the field's absence has a meaning of its own
    defaulted, // absent, the field has the default value
};

struct HXFieldForm {
    std::string_view name;
    HXMember member; // where its number is read to and written from, if anywhere
    HXFieldNeed need = HXFieldNeed::required;
    uint64_t defaultValue = 0;  // signed values sign-extended
    bool isHexadecimal = false; // how it is written

    constexpr HXFieldKind kind() const { return member.kind; }

    static constexpr HXFieldForm required(std::string_view name, HXMember member) {
        return {name, member, HXFieldNeed::required};
    }
    static constexpr HXFieldForm optional(std::string_view name, HXMember member) {
        return {name, member, HXFieldNeed::optional};
    }
    // A text's default is always empty.
    static constexpr HXFieldForm defaulted(std::string_view name, HXMember member, uint64_t value = 0) {
        return {name, member, HXFieldNeed::defaulted, value};
    }
    constexpr HXFieldForm inHexadecimal() const {
        HXFieldForm form = *this;
        form.isHexadecimal = true;
        return form;
    }
};

inline constexpr size_t kMaxCaptureFields = 32;

struct HXRecordForm {
    std::string_view word;
    std::span<const HXFieldForm> fields; // at most kMaxCaptureFields
    uint32_t required = 0;               // a bit for each field that is

    constexpr HXRecordForm(std::string_view ofWord, std::span<const HXFieldForm> ofFields)
        : word(ofWord), fields(ofFields) {
        for (size_t i = 0; i < fields.size(); i++)
            if (fields[i].need == HXFieldNeed::required) required |= uint32_t{1} << i;
    }
};

struct HXCaptureFormat {
    std::string_view header;        // the first line
    std::string_view headerProblem; // the reason given for any other first line
    std::span<const HXRecordForm> records;
};

inline constexpr size_t kMaxCaptureRecordBytes = 1 << 20; // without the newline
