// Arrays and dictionaries: handles on shared nodes that are copied when a change would be seen by others.
#include <algorithm>
#include <limits>

#include "Values/Value.h"

namespace veltoid {
namespace detail {

struct ArrayNode final : Node {
    std::vector<Value> elements;
};

/// Entries in insertion order, with an open-addressing index beside them once a scan would cost more.
struct DictionaryNode final : Node {
    static constexpr size_t kMaxScanned = 8;
    static constexpr uint32_t kFree = 0;
    static constexpr size_t kNotFound = std::numeric_limits<size_t>::max();

    std::vector<Dictionary::Entry> entries;
    /// Entry position + 1; a power of two in size, at most half full; empty while entries are scanned.
    std::vector<uint32_t> slots;

    static size_t hashOf(std::string_view key) { return std::hash<std::string_view>()(key); }

    size_t find(std::string_view key) const {
        if (slots.empty()) {
            for (size_t position = 0; position < entries.size(); ++position)
                if (entries[position].key.view() == key) return position;
            return kNotFound;
        }
        const size_t mask = slots.size() - 1;
        for (size_t slot = hashOf(key) & mask; slots[slot] != kFree; slot = (slot + 1) & mask)
            if (entries[slots[slot] - 1].key.view() == key) return slots[slot] - 1;
        return kNotFound;
    }

    static std::string_view textOf(std::string_view key) { return key; }
    static std::string_view textOf(const String& key) { return key.view(); }

    /// A String is shared as the entry's key; a text becomes a new one.
    template <typename Key>
    void set(const Key& key, Value value) {
        const size_t position = find(textOf(key));
        if (position != kNotFound) {
            entries[position].value = std::move(value);
            return;
        }
        entries.push_back({String(key), std::move(value)});
        if (entries.size() * 2 > slots.size()) {
            rebuildIndex();
        } else {
            occupy(entries.size() - 1);
        }
    }

    void rebuildIndex() {
        slots.clear();
        if (entries.size() <= kMaxScanned) return;
        size_t capacity = 4 * kMaxScanned;
        while (capacity < entries.size() * 4) capacity *= 2;
        slots.assign(capacity, kFree);
        for (size_t position = 0; position < entries.size(); ++position) occupy(position);
    }

  private:
    void occupy(size_t position) {
        if (slots.empty()) return;
        const size_t mask = slots.size() - 1;
        size_t slot = hashOf(entries[position].key.view()) & mask;
        while (slots[slot] != kFree) slot = (slot + 1) & mask;
        slots[slot] = static_cast<uint32_t>(position + 1);
    }
};

namespace {

/// Makes `handle` the only holder of its node, copying what `copy` names from a shared one.
template <typename Kind, typename Copy>
Kind& makeWritable(Handle<Kind>& handle, Copy copy) {
    if (!handle) {
        handle = Handle<Kind>(new Kind);
    } else if (handle.isShared()) {
        auto* fresh = new Kind;
        copy(*fresh, *handle.get());
        handle = Handle<Kind>(fresh);
    }
    return *handle.get();
}

}  // namespace
}  // namespace detail

Array::Array(std::initializer_list<Value> elements) {
    reserve(elements.size());
    for (const Value& element : elements) append(element);
}

size_t Array::size() const { return node_ ? node_->elements.size() : 0; }
const Value& Array::operator[](size_t index) const { return node_->elements[index]; }
const Value* Array::begin() const { return node_ ? node_->elements.data() : nullptr; }
const Value* Array::end() const { return begin() + size(); }

detail::ArrayNode& Array::writable() {
    return detail::makeWritable(node_, [](detail::ArrayNode& to, const detail::ArrayNode& from) {
        to.elements.reserve(from.elements.size() + 1);
        to.elements = from.elements;
    });
}

void Array::append(Value value) {
    if (!value.isAbsent()) writable().elements.push_back(std::move(value));
}

void Array::reserve(size_t count) { writable().elements.reserve(count); }

bool operator==(const Array& a, const Array& b) {
    return a.node_.get() == b.node_.get() || std::equal(a.begin(), a.end(), b.begin(), b.end());
}

Dictionary::Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries) {
    for (const auto& [key, value] : entries) set(key, value);
}

size_t Dictionary::size() const { return node_ ? node_->entries.size() : 0; }
const Dictionary::Entry* Dictionary::begin() const { return node_ ? node_->entries.data() : nullptr; }
const Dictionary::Entry* Dictionary::end() const { return begin() + size(); }

const Value& Dictionary::operator[](std::string_view key) const {
    const size_t position = node_ ? node_->find(key) : detail::DictionaryNode::kNotFound;
    return position == detail::DictionaryNode::kNotFound ? absentValue() : node_->entries[position].value;
}

bool Dictionary::contains(std::string_view key) const { return !(*this)[key].isAbsent(); }

detail::DictionaryNode& Dictionary::writable() {
    return detail::makeWritable(node_, [](detail::DictionaryNode& to, const detail::DictionaryNode& from) {
        to.entries = from.entries;
        to.slots = from.slots;
    });
}

void Dictionary::set(std::string_view key, Value value) {
    if (!value.isAbsent()) writable().set(key, std::move(value));
}

void Dictionary::set(const String& key, Value value) {
    if (!value.isAbsent() && key) writable().set(key, std::move(value));
}

bool Dictionary::remove(std::string_view key) {
    if (!contains(key)) return false;
    detail::DictionaryNode& node = writable();
    node.entries.erase(node.entries.begin() + static_cast<ptrdiff_t>(node.find(key)));
    node.rebuildIndex();
    return true;
}

void Dictionary::reserve(size_t count) { writable().entries.reserve(count); }

String Dictionary::string(std::string_view key) const { return (*this)[key].asString(); }
Data Dictionary::data(std::string_view key) const { return (*this)[key].asData(); }
std::optional<bool> Dictionary::boolean(std::string_view key) const { return (*this)[key].asBoolean(); }
std::optional<double> Dictionary::date(std::string_view key) const { return (*this)[key].asDate(); }
std::optional<double> Dictionary::number(std::string_view key) const { return (*this)[key].asDouble(); }
const Array* Dictionary::array(std::string_view key) const { return (*this)[key].asArray(); }
const Dictionary* Dictionary::dictionary(std::string_view key) const { return (*this)[key].asDictionary(); }

bool operator==(const Dictionary& a, const Dictionary& b) {
    if (a.node_.get() == b.node_.get()) return true;
    return a.size() == b.size() && std::all_of(a.begin(), a.end(), [&](const Dictionary::Entry& entry) {
               return entry.value == b[entry.key.view()];
           });
}

}  // namespace veltoid
