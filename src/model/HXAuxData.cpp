#include "model/HXAuxData.h"

#include "platform/HXInternalError.h"

#include <algorithm>

namespace {

// Sums of figures wrap as the host's 64-bit words do.
int64_t wrappingSum(int64_t a, int64_t b) {
    return static_cast<int64_t>(static_cast<uint64_t>(a) + static_cast<uint64_t>(b));
}

} // namespace

std::string HXAuxDictionary::jsonRepresentation() const {
    std::string json = "{";
    for (const auto &[key, node] : _entries) {
        if (json.size() > 1) json += ',';
        json += '"' + key + "\":" + node->jsonRepresentation();
    }
    return json + "}";
}

void HXAuxDictionary::set(std::string_view key, HXAuxNode node) {
    const auto found =
        std::find_if(_entries.begin(), _entries.end(), [&](auto &e) { return e.first == key; });
    if (found != _entries.end())
        found->second = std::move(node);
    else
        _entries.emplace_back(key, std::move(node));
}

HXAuxNode HXAuxDictionary::get(std::string_view key) const {
    const auto found =
        std::find_if(_entries.begin(), _entries.end(), [&](auto &e) { return e.first == key; });
    return found == _entries.end() ? nullptr : found->second;
}

HXAuxNode HXAuxDictionary::mergeAuxDatum(const HXAuxNode &first, const HXAuxNode &second) {
    HXRequire(!second || first->isContainer() == second->isContainer(), "mergeAuxDatum",
              "!datum2 || datum1.isContainer == datum2.isContainer");
    if (first->isContainer())
        return static_cast<const HXAuxDictionary &>(*first).mergeWithData(
            static_cast<const HXAuxDictionary *>(second.get()));
    const auto &leaf = static_cast<const HXAuxData &>(*first);
    if (!leaf.shouldAggregate()) return nullptr;
    if (!second) return first;
    const auto &other = static_cast<const HXAuxData &>(*second);
    return std::make_shared<HXAuxData>(wrappingSum(leaf.value(), other.value()), true);
}

HXAuxTree HXAuxDictionary::mergeWithData(const HXAuxDictionary *other) const {
    auto result = std::make_shared<HXAuxDictionary>();
    for (const auto &[key, node] : _entries)
        if (HXAuxNode merged = mergeAuxDatum(node, other ? other->get(key) : nullptr))
            result->set(key, std::move(merged));
    if (other)
        for (const auto &[key, node] : other->_entries)
            if (!get(key))
                if (HXAuxNode merged = mergeAuxDatum(node, nullptr)) result->set(key, std::move(merged));
    return result->_entries.empty() ? nullptr : result;
}
