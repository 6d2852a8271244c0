#include "s2s_pobject.h"

#include <cstdio>
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
        PObject taken;
        taken.swap(other);
        swap(taken);  // the old content leaves with `taken`
    }
    return *this;
}

bool PObject::isEmpty() const {
    if (isNull()) {
        return true;
    }
    switch (type_) {
        case kString:
            return static_cast<const std::string*>(payload_)->empty();
        case kArray:
            return static_cast<const Array*>(payload_)->empty();
        case kMap:
            return static_cast<const Map*>(payload_)->empty();
        default:
            return false;  // an integer is never empty, also when 0
    }
}

unsigned long long PObject::asUInt64() const {
    if (isInteger() && !isNull()) {
        return *static_cast<const unsigned long long*>(payload_);
    }
    return 0;
}

bool PObject::asBool() const {
    if (isInteger() && !isNull()) {
        return asUInt64() != 0;
    }
    return !isEmpty();
}

std::string PObject::asString() const {
    if (isString() && !isNull()) {
        return *static_cast<const std::string*>(payload_);
    }
    if (isInteger() && !isNull()) {
        char text[64];
        std::snprintf(text, sizeof(text), "%u", asUInt32());
        return text;
    }
    return std::string();
}

const PObject::Array& PObject::asArray() const {
    if (isArray() && !isNull()) {
        return *static_cast<const Array*>(payload_);
    }
    return GetEmptyArray();
}

const PObject::Map& PObject::asMap() const {
    if (isMap() && !isNull()) {
        return *static_cast<const Map*>(payload_);
    }
    return GetEmptyMap();
}

PObject::Array& PObject::asArray() {
    if (!isArray() || isNull()) {
        copy(Array());
    }
    return *static_cast<Array*>(payload_);
}

PObject::Map& PObject::asMap() {
    if (!isMap() || isNull()) {
        copy(Map());
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
    if (isMap() && !isNull()) {
        const PObject* entry = MapEntryAt(index);
        if (entry != nullptr) {
            return const_cast<PObject&>(*entry);
        }
    }
    throw std::out_of_range(kIndexError);
}

const PObject& PObject::operator[](const std::string& key) const {
    if (isMap() && !isNull()) {
        const Map& map = asMap();
        auto it = map.find(key);
        if (it != map.end()) {
            return it->second;
        }
    }
    return GetEmptyObject();
}

const PObject& PObject::operator[](unsigned int index) const {
    if (isNull()) {
        return GetEmptyObject();
    }
    if (isArray()) {
        const Array& array = asArray();
        return index < array.size() ? array[index] : GetEmptyObject();
    }
    if (isMap()) {
        const PObject* entry = MapEntryAt(index);
        return entry != nullptr ? *entry : GetEmptyObject();
    }
    return GetEmptyObject();
}

bool PObject::hasMember(const std::string& key) const {
    return isMap() && !isNull() && asMap().count(key) != 0;
}

void PObject::clear() {
    if (isNull()) {
        type_ = kNull;
        return;
    }
    if (isContainer()) {
        // A tree decoded from a peer may be nested a million levels deep: release it with an
        // explicit work list instead of recursion, so the depth never reaches the call stack.
        std::vector<PObject> pending;
        TakeChildren(pending);
        while (!pending.empty()) {
            PObject last;
            last.swap(pending.back());
            pending.pop_back();
            last.TakeChildren(pending);
        }
    }
    switch (type_) {
        case kString:
            delete static_cast<std::string*>(payload_);
            break;
        case kInteger:
            delete static_cast<unsigned long long*>(payload_);
            break;
        case kMap:
            delete static_cast<Map*>(payload_);
            break;
        case kArray:
            delete static_cast<Array*>(payload_);
            break;
        default:
            break;  // no payload type is known for other codes
    }
    type_ = kNull;
    payload_ = nullptr;
}

// Moves the container children of this object onto `pending`, leaving only leaves behind.
void PObject::TakeChildren(std::vector<PObject>& pending) {
    if (isNull()) {
        return;
    }
    if (type_ == kArray) {
        for (PObject& element : *static_cast<Array*>(payload_)) {
            if (element.isContainer() && !element.isNull()) {
                pending.emplace_back();
                pending.back().swap(element);
            }
        }
    } else if (type_ == kMap) {
        for (auto& entry : *static_cast<Map*>(payload_)) {
            if (entry.second.isContainer() && !entry.second.isNull()) {
                pending.emplace_back();
                pending.back().swap(entry.second);
            }
        }
    }
}

void PObject::copy(const PObject& other) {
    // Clears first, on purpose: self-assignment leaves the object null, and assigning one of its
    // own descendants is not supported.
    clear();
    if (other.isNull()) {
        return;
    }
    switch (other.type_) {
        case kInteger:
            copy(other.asUInt64());
            break;
        case kString:
            copy(other.asString());
            break;
        case kArray:
            copy(other.asArray());
            break;
        case kMap:
            copy(other.asMap());
            break;
        default:
            break;
    }
}

void PObject::swap(PObject& other) noexcept {
    std::swap(type_, other.type_);
    std::swap(payload_, other.payload_);
}

void PObject::Print(std::string& out) const {
    if (isNull()) {
        out += "null";
        return;
    }
    switch (type_) {
        case kInteger:
            out += std::to_string(asUInt64());
            break;
        case kString:
            out += '"';
            out += *static_cast<const std::string*>(payload_);
            out += '"';
            break;
        case kArray: {
            out += '[';
            const char* separator = "";
            for (const PObject& element : asArray()) {
                out += separator;
                element.Print(out);
                separator = ", ";
            }
            out += ']';
            break;
        }
        case kMap: {
            out += '{';
            const char* separator = "";
            for (const auto& entry : asMap()) {
                out += separator;
                out += '"';
                out += entry.first;
                out += "\": ";
                entry.second.Print(out);
                separator = ", ";
            }
            out += '}';
            break;
        }
        default:
            break;  // other type codes contribute nothing
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
