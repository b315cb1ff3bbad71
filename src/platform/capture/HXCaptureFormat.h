// What a kind of capture file may hold: its record words and their fields, as tables that its reader and its
// writer share.
#pragma once

#include <bit>
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
// alone, none. Read and written bytewise, since the host's records are packed.
struct HXMember {
    HXFieldKind kind = HXFieldKind::text;
    uint8_t bytes = 0; // 0: none
    uint16_t offset = 0;

    constexpr HXMember() = default;
    // Not explicit: a field without a place is given by its kind.
    constexpr HXMember(HXFieldKind ofKind) : kind(ofKind) {}
    template <std::integral Number>
    static constexpr HXMember at(size_t offset) {
        constexpr HXFieldKind unsignedKinds[] = {HXFieldKind::unsigned8, HXFieldKind::unsigned16,
                                                 HXFieldKind::unsigned32, HXFieldKind::unsigned64};
        HXMember member(unsignedKinds[std::bit_width(sizeof(Number)) - 1]);
        static_assert(!std::signed_integral<Number> || sizeof(Number) == sizeof(int32_t));
        if (std::signed_integral<Number>) member.kind = HXFieldKind::signed32;
        if (std::same_as<Number, bool>) member.kind = HXFieldKind::boolean;
        member.bytes = sizeof(Number);
        member.offset = static_cast<uint16_t>(offset);
        return member;
    }

    constexpr bool exists() const { return bytes != 0; }
    // The number, sign-extended.
    uint64_t of(const void *record) const {
        uint64_t number = 0;
        std::memcpy(&number, static_cast<const char *>(record) + offset, bytes);
        return kind == HXFieldKind::signed32 ? static_cast<uint64_t>(static_cast<int32_t>(number)) : number;
    }
    // Stores as much of `number` as the member has bits.
    void set(void *record, uint64_t number) const {
        std::memcpy(static_cast<char *>(record) + offset, &number, bytes);
    }
    static_assert(std::endian::native == std::endian::little, "a number's low bytes come first");
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
    bool isHexadecimal = false; // how it is written
    uint64_t defaultValue = 0;  // signed values sign-extended

    constexpr HXFieldKind kind() const { return member.kind; }

    static constexpr HXFieldForm required(std::string_view name, HXMember member) { return {name, member}; }
    static constexpr HXFieldForm optional(std::string_view name, HXMember member) {
        return {name, member, HXFieldNeed::optional};
    }
    // A text's default is always empty.
    static constexpr HXFieldForm defaulted(std::string_view name, HXMember member, uint64_t value = 0) {
        return {name, member, HXFieldNeed::defaulted, false, value};
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
    uint64_t longestFile = UINT64_MAX; // bytes
};

inline constexpr size_t kMaxCaptureRecordBytes = 1 << 20; // without the newline
