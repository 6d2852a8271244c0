// PObject: storage, access, copying, printing and release of the library's dynamic value.
#include "s2s_pobject.h"

#include <cstdio>
#include <iterator>
#include <stdexcept>
#include <utility>

namespace S2S {

namespace {

const char kIndexError[] = "out_of_range: PObject::operator[]";

}  // namespace

PObject::PObject(unsigned long long value) {
    copy(value);
}
PObject::PObject(const std::string& value) {
    copy(value);
}
PObject::PObject(const char* value) {
    copy(std::string(value));
}
PObject::PObject(const PObject& other) {
    copy(other);
}
PObject::~PObject() {
    clear();
}

PObject& PObject::operator=(unsigned long long value) {
    copy(value);
    return *this;
}

PObject& PObject::operator=(unsigned int value) {
    copy(static_cast<unsigned long long>(value));
    return *this;
}

PObject& PObject::operator=(bool value) {
    copy(static_cast<unsigned long long>(value ? 1 : 0));
    return *this;
}

PObject& PObject::operator=(int value) {
    copy(static_cast<unsigned long long>(static_cast<long long>(value)));
    return *this;
}

PObject& PObject::operator=(const std::string& value) {
    copy(value);
    return *this;
}

PObject& PObject::operator=(const char* value) {
    copy(std::string(value));
    return *this;
}

PObject& PObject::operator=(const Array& value) {
    copy(value);
    return *this;
}

PObject& PObject::operator=(const Map& value) {
    copy(value);
    return *this;
}

PObject& PObject::operator=(const PObject& other) {
    copy(other);
    return *this;
}

PObject& PObject::operator=(PObject&& other) noexcept {
    if (this != &other) {
        PObject taken(std::move(other));
        swap(taken);  // the old content leaves with `taken`
    }
    return *this;
}

bool PObject::isEmpty() const {
    switch (type_) {
        case kNull:
            return true;
        case kString:
            return static_cast<const std::string*>(payload_)->empty();
        case kArray:
            return payload_ == nullptr || static_cast<const Array*>(payload_)->empty();
        case kMap:
            return payload_ == nullptr || static_cast<const Map*>(payload_)->empty();
        default:
            return false;  // an integer is never empty, also when 0
    }
}

unsigned long long PObject::asUInt64() const {
    return type_ == kInteger ? number_ : 0;
}

bool PObject::asBool() const {
    if (type_ == kInteger) {
        return number_ != 0;
    }
    return !isEmpty();
}

std::string PObject::asString() const {
    if (type_ == kString) {
        return *static_cast<const std::string*>(payload_);
    }
    if (type_ == kInteger) {
        char text[64];
        std::snprintf(text, sizeof(text), "%u", asUInt32());
        return text;
    }
    return std::string();
}

const PObject::Array& PObject::asArray() const {
    if (type_ == kArray && payload_ != nullptr) {
        return *static_cast<const Array*>(payload_);
    }
    return GetEmptyArray();
}

const PObject::Map& PObject::asMap() const {
    if (type_ == kMap && payload_ != nullptr) {
        return *static_cast<const Map*>(payload_);
    }
    return GetEmptyMap();
}

PObject::Array& PObject::asArray() {
    if (type_ != kArray) {
        clear();
        type_ = kArray;
    }
    if (payload_ == nullptr) {
        payload_ = new Array();
    }
    return *static_cast<Array*>(payload_);
}

PObject::Map& PObject::asMap() {
    if (type_ != kMap) {
        clear();
        type_ = kMap;
    }
    if (payload_ == nullptr) {
        payload_ = new Map();
    }
    return *static_cast<Map*>(payload_);
}

PObject& PObject::operator[](const std::string& key) {
    return asMap()[key];
}

// The entry at a position in key order. The index is read as a signed 32-bit number; a negative
// one, or one at or past the end, has no entry.
const PObject* PObject::MapEntryAt(unsigned int index) const {
    const Map& map = asMap();
    int position = static_cast<int>(index);
    if (position < 0 || static_cast<size_t>(position) >= map.size()) {
        return nullptr;
    }
    auto it = map.begin();
    std::advance(it, position);
    return &it->second;
}

PObject& PObject::operator[](unsigned int index) {
    // Mutable array elements are reached through asArray(), never here.
    if (type_ == kMap) {
        const PObject* entry = MapEntryAt(index);
        if (entry != nullptr) {
            return const_cast<PObject&>(*entry);
        }
    }
    throw std::out_of_range(kIndexError);
}

const PObject& PObject::operator[](const std::string& key) const {
    if (type_ == kMap && payload_ != nullptr) {
        const Map& map = *static_cast<const Map*>(payload_);
        auto it = map.find(key);
        if (it != map.end()) {
            return it->second;
        }
    }
    return GetEmptyObject();
}

const PObject& PObject::operator[](unsigned int index) const {
    if (type_ == kArray) {
        const Array& array = asArray();
        return index < array.size() ? array[index] : GetEmptyObject();
    }
    if (type_ == kMap) {
        const PObject* entry = MapEntryAt(index);
        return entry != nullptr ? *entry : GetEmptyObject();
    }
    return GetEmptyObject();
}

bool PObject::hasMember(const std::string& key) const {
    return type_ == kMap && payload_ != nullptr &&
           static_cast<const Map*>(payload_)->count(key) != 0;
}

void PObject::clear() {
    switch (type_) {
        case kString:
            delete static_cast<std::string*>(payload_);
            break;
        case kArray:
        case kMap:
            if (payload_ != nullptr) {
                // A tree decoded from a peer may be nested a million levels deep: release it with
                // an explicit work list instead of recursion, so the depth never reaches the call
                // stack. Only containers that hold containers need the list.
                std::vector<PObject> pending;
                TakeChildren(pending);
                while (!pending.empty()) {
                    PObject last(std::move(pending.back()));
                    pending.pop_back();
                    last.TakeChildren(pending);
                }
                if (type_ == kArray) {
                    delete static_cast<Array*>(payload_);
                } else {
                    delete static_cast<Map*>(payload_);
                }
            }
            break;
        default:
            break;  // null and integers hold nothing outside the object
    }
    type_ = kNull;
    payload_ = nullptr;
}

// Moves the non-empty container children of this object onto `pending`, leaving only leaves.
void PObject::TakeChildren(std::vector<PObject>& pending) {
    auto take = [&pending](PObject& child) {
        if (child.isContainer() && child.payload_ != nullptr) {
            pending.emplace_back(std::move(child));
        }
    };
    if (payload_ == nullptr) {
        return;
    }
    if (type_ == kArray) {
        for (PObject& element : *static_cast<Array*>(payload_)) {
            take(element);
        }
    } else if (type_ == kMap) {
        for (auto& entry : *static_cast<Map*>(payload_)) {
            take(entry.second);
        }
    }
}

template <>
void PObject::copy<unsigned long long>(const unsigned long long& value) {
    clear();
    type_ = kInteger;
    number_ = value;
}

template <>
void PObject::copy<std::string>(const std::string& value) {
    // Built before the old content goes: `value` may live inside this object.
    std::string* fresh = new std::string(value);
    clear();
    type_ = kString;
    payload_ = fresh;
}

template <>
void PObject::copy<PObject::Array>(const Array& value) {
    PObject fresh;
    if (!value.empty()) {
        Array& items = fresh.asArray();
        items.resize(value.size());
        for (size_t i = 0; i < value.size(); ++i) {
            items[i].copy(value[i]);
        }
    } else {
        fresh.type_ = kArray;
    }
    swap(fresh);  // the old content leaves with `fresh`
}

template <>
void PObject::copy<PObject::Map>(const Map& value) {
    PObject fresh;
    if (!value.empty()) {
        Map& map = fresh.asMap();
        for (const auto& entry : value) {
            map.emplace_hint(map.end(), entry.first, PObject())->second.copy(entry.second);
        }
    } else {
        fresh.type_ = kMap;
    }
    swap(fresh);
}

void PObject::copy(const PObject& other) {
    // Clears first, on purpose: self-assignment leaves the object null, and assigning one of its
    // own descendants is not supported.
    clear();
    // Containers are copied level by level from a work list: each pair is a source container and
    // its still empty copy; children that are containers themselves join the list.
    std::vector<std::pair<const PObject*, PObject*>> pending;
    pending.emplace_back(&other, this);
    while (!pending.empty()) {
        const PObject& from = *pending.back().first;
        PObject& to = *pending.back().second;
        pending.pop_back();
        switch (from.type_) {
            case kInteger:
                to.type_ = kInteger;
                to.number_ = from.number_;
                break;
            case kString:
                to.payload_ = new std::string(*static_cast<const std::string*>(from.payload_));
                to.type_ = kString;
                break;
            case kArray: {
                to.type_ = kArray;
                const Array& items = from.asArray();
                if (items.empty()) {
                    break;
                }
                // Sized once, so the addresses on the work list stay valid.
                Array& copies = to.asArray();
                copies.resize(items.size());
                for (size_t i = items.size(); i-- > 0;) {
                    pending.emplace_back(&items[i], &copies[i]);
                }
                break;
            }
            case kMap: {
                to.type_ = kMap;
                const Map& map = from.asMap();
                if (map.empty()) {
                    break;
                }
                Map& copies = to.asMap();
                for (auto it = map.rbegin(); it != map.rend(); ++it) {
                    auto at = copies.emplace_hint(copies.begin(), it->first, PObject());
                    pending.emplace_back(&it->second, &at->second);
                }
                break;
            }
            default:
                break;  // null stays null
        }
    }
}

void PObject::swap(PObject& other) noexcept {
    std::swap(type_, other.type_);
    std::swap(number_, other.number_);
}

void PObject::Print(std::string& out) const {
    // The text is written from a work list rather than by recursion, so that any depth prints.
    // Each step is a value still to print, or (value null) the separator/closing text to append.
    struct Step {
        const PObject* value;
        const char* text;
        const std::string* key;
    };
    std::vector<Step> pending;
    pending.push_back(Step{this, nullptr, nullptr});
    while (!pending.empty()) {
        Step step = pending.back();
        pending.pop_back();
        if (step.key != nullptr) {
            out += '"';
            out += *step.key;
            out += "\": ";
        }
        if (step.value == nullptr) {
            out += step.text;
            continue;
        }
        const PObject& value = *step.value;
        switch (value.type_) {
            case kNull:
                out += "null";
                break;
            case kInteger:
                out += std::to_string(value.number_);
                break;
            case kString:
                out += '"';
                out += *static_cast<const std::string*>(value.payload_);
                out += '"';
                break;
            case kArray: {
                out += '[';
                pending.push_back(Step{nullptr, "]", nullptr});
                const Array& items = value.asArray();
                for (size_t i = items.size(); i-- > 0;) {
                    pending.push_back(Step{&items[i], nullptr, nullptr});
                    if (i > 0) {
                        pending.push_back(Step{nullptr, ", ", nullptr});
                    }
                }
                break;
            }
            case kMap: {
                out += '{';
                pending.push_back(Step{nullptr, "}", nullptr});
                const Map& map = value.asMap();
                for (auto it = map.rbegin(); it != map.rend(); ++it) {
                    pending.push_back(Step{&it->second, nullptr, &it->first});
                    if (std::next(it) != map.rend()) {
                        pending.push_back(Step{nullptr, ", ", nullptr});
                    }
                }
                break;
            }
            default:
                break;  // other type codes contribute nothing
        }
    }
}

std::string PObject::toString() const {
    std::string out;
    Print(out);
    return out;
}

// The shared empties live from first use to process exit (function-local statics: thread-safe
// one-time initialisation).
const PObject::Map& PObject::GetEmptyMap() {
    static const Map empty;
    return empty;
}

const PObject::Array& PObject::GetEmptyArray() {
    static const Array empty;
    return empty;
}

const PObject& PObject::GetEmptyObject() {
    static const PObject empty;
    return empty;
}

}  // namespace S2S
