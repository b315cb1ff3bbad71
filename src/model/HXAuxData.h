// Auxiliary data: named figures that a process reports beside its categories, as a tree.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

// A node: a leaf (HXAuxData) or a container (HXAuxDictionary). At a given path a node is a leaf in every tree
// or a container in every tree.
class HXAuxDataType {
  public:
    virtual ~HXAuxDataType() = default;
    virtual bool isContainer() const = 0;
    // The node as JSON text: a number, or an object with all keys, aggregating or not.
    virtual std::string jsonRepresentation() const = 0;
};
using HXAuxNode = std::shared_ptr<const HXAuxDataType>;

class HXAuxData : public HXAuxDataType {
  public:
    // `aggregate`: the value is summed across processes; otherwise it belongs to its process only.
    HXAuxData(int64_t value, bool aggregate) : _aggregate(aggregate), _value(value) {}

    bool isContainer() const override { return false; }
    std::string jsonRepresentation() const override { return std::to_string(_value); }
    bool shouldAggregate() const { return _aggregate; }
    int64_t value() const { return _value; }

  private:
    bool _aggregate;
    int64_t _value;
};

// A dictionary from name to node, read in the order in which keys were first set.
class HXAuxDictionary : public HXAuxDataType {
  public:
    using Entries = std::vector<std::pair<std::string, HXAuxNode>>;

    bool isContainer() const override { return true; }
    std::string jsonRepresentation() const override;

    // Sets or replaces an entry.
    void set(std::string_view key, HXAuxNode node);
    // The node of a key; null when there is none.
    HXAuxNode get(std::string_view key) const;
    const Entries &entries() const { return _entries; }

    // This tree and `other` (may be null) summed: aggregating leaves only, and the containers that still hold
    // some. Null when nothing is left.
    std::shared_ptr<const HXAuxDictionary> mergeWithData(const HXAuxDictionary *other) const;
    // The same for two nodes of one path; null when the datum is dropped. `second` may be null.
    static HXAuxNode mergeAuxDatum(const HXAuxNode &first, const HXAuxNode &second);

  private:
    Entries _entries;
};
using HXAuxTree = std::shared_ptr<const HXAuxDictionary>;
