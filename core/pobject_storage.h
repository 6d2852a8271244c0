// How a PObject holds a string or a map, for the value itself (core/pobject.cpp) and for the
// stream codec, which builds and walks these forms directly.
//
// A string is a TextBlock: its length and its bytes (NUL-terminated for log lines) in one block.
// A map is either the std::map that asMap() hands out, or a FlatMap: its entries in one block,
// sorted by key, keys stored after the entries. The decoder builds flat maps (it learns each
// map's size at its end tag); a flat map becomes a std::map the first time a caller asks for a
// reference into it (asMap(), either operator[], an integer index), and stays one. Lookups that
// hand out nothing (hasMember, a missing key, printing, copying, sending, releasing) read the
// flat form as it is.
// An array is likewise the std::vector that asArray() hands out, or a FlatArray: the items of an
// array of leaves (nulls, integers, strings of its arena) that the decoder found whole in its
// buffer, in one block. It becomes a std::vector the first time a caller asks for a reference
// into it (asArray(), an integer index).
//
// Blocks come from the heap or from an Arena: one per decoded message, filled by bumping a
// pointer and freed in chunks once its last block is released. Every block names its arena
// (null: heap), so a part of a message that is moved elsewhere keeps the arena alive; the count
// of live blocks is atomic because two parts of one message may be released by two threads.
#ifndef S2S_CORE_POBJECT_STORAGE_H
#define S2S_CORE_POBJECT_STORAGE_H

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <map>
#include <new>
#include <string>

#include "core/copy_bytes.h"
#include "s2s_pobject.h"

namespace S2S {

class Arena {
  public:
    // A new arena, held by its creator until Finish().
    static Arena* Create();
    Arena(const Arena&) = delete;
    Arena& operator=(const Arena&) = delete;

    // `size` bytes aligned to 8, counted as one live block. Creator's thread only.
    void* Allocate(size_t size) {
        size = (size + 7) & ~size_t{7};
        if (size > static_cast<size_t>(limit_ - cursor_)) {
            return AllocateSlow(size);
        }
        void* at = cursor_;
        cursor_ += size;
        ++allocated_;
        return at;
    }
    // The creator lets go: from now on the arena lives exactly as long as its blocks.
    void Finish();
    // `blocks` of its blocks were released; the last release frees every chunk.
    void Release(size_t blocks);

    struct Chunk {
        Chunk* next;
        size_t size;
    };

  private:
    Arena() = default;
    void* AllocateSlow(size_t size);
    void Grow(size_t size);
    void Destroy();

    // While the creator holds the arena the count carries a large hold, so that blocks released
    // during the build (a value received twice) never bring it to zero early.
    static constexpr size_t kCreatorHold = size_t{1} << 48;
    std::atomic<size_t> live_{kCreatorHold};
    size_t allocated_ = 0;
    Chunk* chunks_ = nullptr;
    char* cursor_ = nullptr;
    char* limit_ = nullptr;
    size_t next_size_ = 0;
};

struct TextBlock {
    Arena* arena;
    size_t size;
    const char* data() const { return reinterpret_cast<const char*>(this + 1); }
    char* data() { return reinterpret_cast<char*>(this + 1); }
};

struct FlatEntry {
    PObject value;
    uint32_t key_offset;  // from the start of the map's key bytes
    uint32_t key_size;
};

struct FlatMap {
    Arena* arena;
    uint32_t count;  // at least 1: an empty map has no payload
    uint32_t key_bytes;
    // Non-zero for a map that lives wholly in its arena: its entries are leaves (nulls,
    // integers, strings of its arena) or flat maps and arrays that live wholly in the same
    // arena. The number of arena blocks the map and everything in it take, released together
    // without a walk. A flat map is never changed in place, and nothing in it can be reached for
    // a change while it stays flat, so the count stays true; when it turns into a std::map, its
    // own block goes and each entry keeps its own count.
    uint32_t whole_blocks;
    FlatEntry* entries() { return reinterpret_cast<FlatEntry*>(this + 1); }
    const FlatEntry* entries() const { return reinterpret_cast<const FlatEntry*>(this + 1); }
    const char* keys() const { return reinterpret_cast<const char*>(entries() + count); }
    char* keys() { return reinterpret_cast<char*>(entries() + count); }
    const char* key(uint32_t i) const { return keys() + entries()[i].key_offset; }
};

struct FlatArray {
    Arena* arena;
    uint32_t count;  // at least 1: an empty array has no payload
    // The number of arena blocks the array and its strings take, released together without a
    // walk (every item is a leaf of the array's arena).
    uint32_t whole_blocks;
    PObject* items() { return reinterpret_cast<PObject*>(this + 1); }
    const PObject* items() const { return reinterpret_cast<const PObject*>(this + 1); }
};

// The items of an array in either form, read in place.
struct ItemView {
    const PObject* data;
    size_t size;
    const PObject* begin() const { return data; }
    const PObject* end() const { return data + size; }
};

inline uint32_t ByteSwap(uint32_t v) {
    return __builtin_bswap32(v);
}
inline uint64_t ByteSwap(uint64_t v) {
    return __builtin_bswap64(v);
}
// The order of the words of keys at `x` and `y`, read most significant byte first.
template <typename Word>
inline int KeyWordOrder(const char* x, const char* y) {
    Word u;
    Word v;
    std::memcpy(&u, x, sizeof(u));
    std::memcpy(&v, y, sizeof(v));
    if (u == v) {
        return 0;
    }
    return ByteSwap(u) < ByteSwap(v) ? -1 : 1;
}

// Byte order of keys: what std::string's comparison gives (unsigned bytes, a prefix first).
// Compared a word at a time, most significant byte first; the last word is read where the
// common part ends (overlapping bytes already found equal), so no byte loop runs above 3 bytes.
inline int CompareKeys(const char* a, size_t a_size, const char* b, size_t b_size) {
    const size_t common = a_size < b_size ? a_size : b_size;
    if (common >= 8) {
        size_t i = 0;
        for (; i + 8 <= common; i += 8) {
            if (int order = KeyWordOrder<uint64_t>(a + i, b + i); order != 0) {
                return order;
            }
        }
        if (i < common) {
            if (int order = KeyWordOrder<uint64_t>(a + common - 8, b + common - 8); order != 0) {
                return order;
            }
        }
    } else if (common >= 4) {
        if (int order = KeyWordOrder<uint32_t>(a, b); order != 0) {
            return order;
        }
        if (int order = KeyWordOrder<uint32_t>(a + common - 4, b + common - 4); order != 0) {
            return order;
        }
    } else {
        for (size_t i = 0; i < common; ++i) {
            if (a[i] != b[i]) {
                return static_cast<unsigned char>(a[i]) < static_cast<unsigned char>(b[i]) ? -1 : 1;
            }
        }
    }
    return a_size < b_size ? -1 : (a_size > b_size ? 1 : 0);
}

// The storage side of PObject, for this file's two users.
struct PObjectAccess {
    static bool IsText(const PObject& o) { return o.type_ == PObject::kString; }
    static const TextBlock& Text(const PObject& o) {
        return *static_cast<const TextBlock*>(o.payload_);
    }
    static bool IsFlat(const PObject& o) {
        return o.type_ == PObject::kMap && (reinterpret_cast<uintptr_t>(o.payload_) & 1) != 0;
    }
    // REQUIRES: IsFlat(o).
    static FlatMap& Flat(const PObject& o) {
        return *reinterpret_cast<FlatMap*>(reinterpret_cast<uintptr_t>(o.payload_) - 1);
    }

    static bool IsFlatArray(const PObject& o) {
        return o.type_ == PObject::kArray && (reinterpret_cast<uintptr_t>(o.payload_) & 1) != 0;
    }
    // REQUIRES: IsFlatArray(o).
    static FlatArray& FlatItems(const PObject& o) {
        return *reinterpret_cast<FlatArray*>(reinterpret_cast<uintptr_t>(o.payload_) - 1);
    }
    // REQUIRES: o.isArray().
    static ItemView Items(const PObject& o) {
        if (o.payload_ == nullptr) {
            return ItemView{nullptr, 0};
        }
        if (IsFlatArray(o)) {
            const FlatArray& flat = FlatItems(o);
            return ItemView{flat.items(), flat.count};
        }
        const PObject::Array& items = *static_cast<const PObject::Array*>(o.payload_);
        return ItemView{items.data(), items.size()};
    }

    // Moves `from` into the null object `to`; `from` is null afterwards.
    static void Move(PObject& to, PObject& from) {
        to.type_ = from.type_;
        to.number_ = from.number_;
        from.type_ = PObject::kNull;
        from.payload_ = nullptr;
    }

    // REQUIRES: o.isInteger().
    static unsigned long long Number(const PObject& o) { return o.number_; }
    // Makes the null object `o` the integer `value`.
    static void SetInteger(PObject& o, unsigned long long value) {
        o.type_ = PObject::kInteger;
        o.number_ = value;
    }

    // A text block of `size` bytes from `arena` (null: the heap), NUL-terminated for log lines.
    static TextBlock* NewText(Arena* arena, const char* data, size_t size) {
        const size_t bytes = sizeof(TextBlock) + size + 1;
        void* raw = arena != nullptr ? arena->Allocate(bytes) : ::operator new(bytes);
        TextBlock* text = new (raw) TextBlock{arena, size};
        if (size > 0) {
            CopyBytes(text->data(), data, size);
        }
        text->data()[size] = '\0';
        return text;
    }
    // Makes the null object `o` the string `data`.
    static void SetText(PObject& o, Arena* arena, const char* data, size_t size) {
        o.payload_ = NewText(arena, data, size);
        o.type_ = PObject::kString;
    }
    // Makes `o` the string `data`: the block is built before the old content goes.
    static void AssignText(PObject& o, Arena* arena, const char* data, size_t size) {
        TextBlock* text = NewText(arena, data, size);  // `data` may live inside `o`
        o.clear();
        o.type_ = PObject::kString;
        o.payload_ = text;
    }
    // A flat map of `count` (>= 1) null entries and `key_bytes` key bytes, to be filled in
    // ascending key order.
    static FlatMap* NewFlat(Arena* arena, uint32_t count, uint32_t key_bytes) {
        const size_t bytes = sizeof(FlatMap) + count * sizeof(FlatEntry) + key_bytes;
        void* raw = arena != nullptr ? arena->Allocate(bytes) : ::operator new(bytes);
        FlatMap* flat = new (raw) FlatMap{arena, count, key_bytes, 0};
        FlatEntry* entries = flat->entries();
        for (uint32_t i = 0; i < count; ++i) {
            new (&entries[i]) FlatEntry{PObject(), 0, 0};
        }
        return flat;
    }
    // The block of NewFlat with its entries left unbuilt: the caller constructs every one of
    // them, in order, before anything else sees the map.
    static FlatMap* NewFlatUnfilled(Arena* arena, uint32_t count, uint32_t key_bytes) {
        const size_t bytes = sizeof(FlatMap) + count * sizeof(FlatEntry) + key_bytes;
        void* raw = arena != nullptr ? arena->Allocate(bytes) : ::operator new(bytes);
        return new (raw) FlatMap{arena, count, key_bytes, 0};
    }
    // Makes `o` the map `flat` (null: the empty map), dropping what it held.
    static void AssignFlat(PObject& o, FlatMap* flat) {
        o.clear();
        o.type_ = PObject::kMap;
        o.payload_ = flat == nullptr ? nullptr : reinterpret_cast<char*>(flat) + 1;
    }
    // The flat map of `o` turned into its std::map.
    static PObject::Map& Materialise(PObject& o);

    // A flat array of `count` (>= 1) unbuilt items from `arena`: the caller constructs every
    // one of them, in order, before anything else sees the array.
    static FlatArray* NewFlatArrayUnfilled(Arena* arena, uint32_t count) {
        void* raw = arena->Allocate(sizeof(FlatArray) + count * sizeof(PObject));
        return new (raw) FlatArray{arena, count, 0};
    }
    // Makes the null object `o` the array `flat` (null: the empty array, which holds nothing).
    static void SetFlatArray(PObject& o, FlatArray* flat) {
        o.type_ = PObject::kArray;
        o.payload_ = flat == nullptr ? nullptr : reinterpret_cast<char*>(flat) + 1;
    }
    // The flat array of `o` turned into its std::vector.
    static PObject::Array& MaterialiseArray(PObject& o);
};

}  // namespace S2S

#endif  // S2S_CORE_POBJECT_STORAGE_H
