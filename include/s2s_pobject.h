// PObject: the one dynamic value of the library. Every message that crosses a process boundary is
// a tree of these: null, unsigned 64-bit integer, byte string, array, or map with byte-ordered
// string keys. Deep-copy value semantics; not thread-safe (one object, one thread at a time).
//
// Storage: an integer is held in the object itself; a string, array or map is a separately
// allocated payload. An array or map may have no payload yet: it is then empty, and gets one on
// its first mutable use. A map received from a stream is held in a compact sorted form until a
// reference into it is first asked for (asMap(), operator[], an integer index): then it becomes
// the std::map those return, once, so references handed out stay valid as std::map's do. A
// received array of nulls, integers and strings is likewise held compactly until asArray() or an
// integer index asks for a reference, and then becomes the std::vector they return. That
// first access may change the storage of an object reached through a const reference: like every
// other use, it belongs to the one thread using the object. The parts of a received message share
// its allocation; a part kept after the rest is released keeps that allocation. Copying,
// printing and releasing never recurse, so a tree of any depth (a decoded message may be nested
// a million levels) costs heap, never call stack.
#ifndef S2S_POBJECT_H
#define S2S_POBJECT_H

#include <map>
#include <string>
#include <vector>

#include "s2s_export.h"

namespace S2S {

class S2S_EXPORT PObject {
  public:
    typedef std::vector<PObject> Array;
    // std::string orders its bytes as unsigned chars, a prefix first: the key order of the format.
    typedef std::map<std::string, PObject> Map;

    enum { kNull = 0, kArray = 1, kMap = 2, kInteger = 3, kString = 4 };

    // Type code of a storage type: Array 1, Map 2, unsigned long long 3, std::string 4.
    template <typename T>
    static int type_trait();

    PObject() noexcept {}  // user-provided: a `const PObject` may be default-initialised
    PObject(unsigned long long value);
    PObject(const std::string& value);
    PObject(const char* value);
    PObject(const PObject& other);
    // Moves hand the payload over without copying (containers of PObject grow without deep copies).
    PObject(PObject&& other) noexcept : type_(other.type_) {
        number_ = other.number_;  // the whole payload word, whichever member is in use
        other.type_ = kNull;
        other.payload_ = nullptr;
    }
    // Only a payload needs releasing: a null, an integer or an empty container costs a test.
    ~PObject() {
        if (type_ != kNull && type_ != kInteger && payload_ != nullptr) {
            clear();
        }
    }

    PObject& operator=(unsigned long long value);
    PObject& operator=(unsigned int value);
    PObject& operator=(bool value);
    PObject& operator=(int value);  // sign-extended: -1 is 18446744073709551615
    PObject& operator=(const std::string& value);
    PObject& operator=(const char* value);
    PObject& operator=(const Array& value);
    PObject& operator=(const Map& value);
    // Deep copy through copy(): clears first, so assigning an object to itself leaves it null.
    PObject& operator=(const PObject& other);
    PObject& operator=(PObject&& other) noexcept;

    bool isNull() const { return type_ == kNull; }
    bool isArray() const { return type_ == kArray; }
    bool isMap() const { return type_ == kMap; }
    bool isInteger() const { return type_ == kInteger; }
    bool isString() const { return type_ == kString; }
    bool isContainer() const { return isArray() || isMap(); }
    bool isPrimitive() const { return isString() || isInteger(); }
    bool isEmpty() const;

    unsigned long long asUInt64() const;
    long long asInteger() const { return static_cast<long long>(asUInt64()); }
    long long asInt64() const { return static_cast<long long>(asUInt64()); }
    unsigned int asUInt32() const { return static_cast<unsigned int>(asUInt64()); }
    unsigned short asUInt16() const { return static_cast<unsigned short>(asUInt64()); }
    unsigned char asUInt8() const { return static_cast<unsigned char>(asUInt64()); }
    int asInt32() const { return static_cast<int>(asUInt64()); }
    short asInt16() const { return static_cast<short>(asUInt64()); }
    signed char asInt8() const { return static_cast<signed char>(asUInt64()); }
    bool asBool() const;
    // An integer reads as the "%u" text of its low 32 bits, on purpose.
    std::string asString() const;
    const Array& asArray() const;
    const Map& asMap() const;

    // Mutable access turns the object into the wanted container first, discarding what it held.
    Array& asArray();
    Map& asMap();
    PObject& operator[](const std::string& key);
    // Never reaches array elements and never inserts: throws std::out_of_range
    // ("out_of_range: PObject::operator[]") for arrays, non-containers and missing map positions.
    PObject& operator[](unsigned int index);
    const PObject& operator[](const std::string& key) const;
    const PObject& operator[](unsigned int index) const;
    bool hasMember(const std::string& key) const;

    void clear();
    void copy(const PObject& other);
    // Typed assignment: the new payload is built before the old one is freed, so a value taken
    // from inside this object may be assigned to it.
    template <typename T>
    void copy(const T& value);
    void swap(PObject& other) noexcept;
    std::string toString() const;

    static const Map& GetEmptyMap();
    static const Array& GetEmptyArray();
    static const PObject& GetEmptyObject();

  private:
    friend struct PObjectAccess;  // the storage forms (core/pobject_storage.h)

    const PObject* MapEntryAt(unsigned int index) const;
    void Print(std::string& out) const;

    // kNull exactly when the object is null; every operation that empties it resets both fields.
    int type_ = kNull;
    union {
        // Owned: a TextBlock, an Array, a Map, or a FlatArray or FlatMap (its address + 1); null
        // for an empty container.
        void* payload_ = nullptr;
        unsigned long long number_;  // an integer's value
    };
};

template <>
inline int PObject::type_trait<PObject::Array>() {
    return kArray;
}
template <>
inline int PObject::type_trait<PObject::Map>() {
    return kMap;
}
template <>
inline int PObject::type_trait<unsigned long long>() {
    return kInteger;
}
template <>
inline int PObject::type_trait<std::string>() {
    return kString;
}

// The typed copies (one per storage type) are defined with the rest of the class.
template <>
void PObject::copy<unsigned long long>(const unsigned long long& value);
template <>
void PObject::copy<std::string>(const std::string& value);
template <>
void PObject::copy<PObject::Array>(const Array& value);
template <>
void PObject::copy<PObject::Map>(const Map& value);

}  // namespace S2S

#endif  // S2S_POBJECT_H
