// PObject: storage, access, copying, printing and release of the library's dynamic value, and
// the arena that decoded messages are built in.
#include "s2s_pobject.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <memory>
#include <new>
#include <stdexcept>
#include <tuple>
#include <utility>

#include "core/pobject_storage.h"

namespace S2S {

namespace {

const char kIndexError[] = "out_of_range: PObject::operator[]";

// A message's first chunk holds a small request whole; later chunks double up to the cap.
constexpr size_t kFirstChunk = 4096;
constexpr size_t kMaxChunk = 64 * 1024;  // below the allocator's mmap threshold
constexpr int kChunkClasses = 5;         // 4 KiB, 8 KiB ... 64 KiB
// Chunks of released arenas that a thread keeps for its next messages, so that a steady stream
// of messages does not fault fresh pages in each time (the allocator gives freed top-of-heap
// memory back to the system).
constexpr size_t kSpareBytes = 512 * 1024;
// Except under AddressSanitizer: there a released chunk goes back at once, so that a part of a
// message read after its arena is gone (a miscounted release) is reported, not read from a kept
// chunk.
#if defined(__SANITIZE_ADDRESS__)
#define S2S_ARENA_SPARES 0
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define S2S_ARENA_SPARES 0
#endif
#endif
#ifndef S2S_ARENA_SPARES
#define S2S_ARENA_SPARES 1
#endif
constexpr bool kKeepSpareChunks = S2S_ARENA_SPARES != 0;

int ChunkClass(size_t size) {
    for (int c = 0; c < kChunkClasses; ++c) {
        if (size == kFirstChunk << c) {
            return c;
        }
    }
    return -1;
}

// Trivially destructible, so that it can still be read during the thread's exit.
struct SpareChunks {
    Arena::Chunk* head[kChunkClasses];
    size_t bytes;
    bool closed;  // the thread is ending: nothing is kept any more
};
thread_local SpareChunks spare_chunks;

// Gives the thread's spare chunks back when the thread ends.
struct SpareChunksOwner {
    ~SpareChunksOwner() {
        spare_chunks.closed = true;
        for (Arena::Chunk*& head : spare_chunks.head) {
            while (head != nullptr) {
                Arena::Chunk* next = head->next;
                ::operator delete(head);
                head = next;
            }
        }
        spare_chunks.bytes = 0;
    }
    void Enlist() {}
};

Arena::Chunk* NewChunk(size_t size) {
    int c = ChunkClass(size);
    if (c >= 0 && spare_chunks.head[c] != nullptr) {
        Arena::Chunk* chunk = spare_chunks.head[c];
        spare_chunks.head[c] = chunk->next;
        spare_chunks.bytes -= size;
        return chunk;
    }
    Arena::Chunk* chunk = static_cast<Arena::Chunk*>(::operator new(size));
    chunk->size = size;
    return chunk;
}

void FreeChunk(Arena::Chunk* chunk) {
    int c = ChunkClass(chunk->size);
    if (kKeepSpareChunks && c >= 0 && !spare_chunks.closed &&
        spare_chunks.bytes + chunk->size <= kSpareBytes) {
        static thread_local SpareChunksOwner owner;
        owner.Enlist();
        chunk->next = spare_chunks.head[c];
        spare_chunks.head[c] = chunk;
        spare_chunks.bytes += chunk->size;
        return;
    }
    ::operator delete(chunk);
}

size_t RoundUp8(size_t size) {
    return (size + 7) & ~size_t{7};
}

// The containers a release still has to visit: the first few in place, so that releasing an
// ordinary message allocates nothing.
class WorkList {
  public:
    // Moves `value` in; it is null afterwards.
    WorkList() = default;
    WorkList(const WorkList&) = delete;
    WorkList& operator=(const WorkList&) = delete;
    ~WorkList() {
        while (count_ > 0) {
            slot(--count_).~PObject();
        }
    }
    void Push(PObject& value) {
        if (count_ < kInPlace) {
            new (&in_place_[count_++]) PObject(std::move(value));
        } else {
            spilled_.emplace_back(std::move(value));
        }
    }
    // Moves the latest value into the null `to`; false when there is none.
    bool Pop(PObject& to) {
        if (!spilled_.empty()) {
            to.swap(spilled_.back());
            spilled_.pop_back();
            return true;
        }
        if (count_ == 0) {
            return false;
        }
        PObject& last = slot(--count_);
        to.swap(last);
        last.~PObject();  // null now
        return true;
    }

  private:
    static constexpr size_t kInPlace = 8;
    // Raw room: a slot holds a PObject only below count_ (nothing is built for an empty list).
    PObject& slot(size_t i) { return *std::launder(reinterpret_cast<PObject*>(&in_place_[i])); }
    struct alignas(PObject) Room {
        unsigned char bytes[sizeof(PObject)];
    };
    Room in_place_[kInPlace];
    size_t count_ = 0;
    std::vector<PObject> spilled_;
};

// Releases of arena blocks are added up and handed to the arena together.
class Releaser {
  public:
    Releaser() = default;
    Releaser(const Releaser&) = delete;
    Releaser& operator=(const Releaser&) = delete;
    ~Releaser() { Flush(); }
    // `block` (with `blocks` - 1 more of the same arena that it alone refers to) is released.
    void Free(void* block, Arena* arena, size_t blocks = 1) {
        if (arena == nullptr) {
            ::operator delete(block);
            return;
        }
        if (arena != arena_) {
            Flush();
            arena_ = arena;
        }
        count_ += blocks;
    }

  private:
    void Flush() {
        if (arena_ != nullptr) {
            arena_->Release(count_);
        }
        arena_ = nullptr;
        count_ = 0;
    }
    Arena* arena_ = nullptr;
    size_t count_ = 0;
};

const FlatEntry* FindFlat(const FlatMap& flat, const std::string& key) {
    const FlatEntry* entries = flat.entries();
    size_t low = 0;
    size_t high = flat.count;
    while (low < high) {
        size_t mid = low + (high - low) / 2;
        int order = CompareKeys(flat.key(static_cast<uint32_t>(mid)), entries[mid].key_size,
                                key.data(), key.size());
        if (order == 0) {
            return &entries[mid];
        }
        if (order < 0) {
            low = mid + 1;
        } else {
            high = mid;
        }
    }
    return nullptr;
}

}  // namespace

// --- Arena -------------------------------------------------------------------------------------

Arena* Arena::Create() {
    // The arena lives at the start of its own first chunk.
    Chunk* chunk = NewChunk(kFirstChunk);
    void* raw = chunk;
    chunk->next = nullptr;
    Arena* arena = new (static_cast<char*>(raw) + sizeof(Chunk)) Arena();
    arena->chunks_ = chunk;
    arena->cursor_ = static_cast<char*>(raw) + RoundUp8(sizeof(Chunk) + sizeof(Arena));
    arena->limit_ = static_cast<char*>(raw) + kFirstChunk;
    arena->next_size_ = kFirstChunk * 2;
    return arena;
}

void* Arena::AllocateSlow(size_t size) {
    Grow(size);
    void* at = cursor_;
    cursor_ += size;
    ++allocated_;
    return at;
}

void Arena::Grow(size_t size) {
    size_t chunk_size = std::max(next_size_, sizeof(Chunk) + size);
    next_size_ = std::min(next_size_ * 2, kMaxChunk);
    Chunk* chunk = NewChunk(chunk_size);
    void* raw = chunk;
    chunk->next = chunks_;
    chunks_ = chunk;
    cursor_ = static_cast<char*>(raw) + sizeof(Chunk);
    limit_ = static_cast<char*>(raw) + chunk_size;
}

void Arena::Finish() {
    // The hold gives way to the blocks handed out, in one step.
    Release(kCreatorHold - allocated_);
}

void Arena::Release(size_t blocks) {
    const size_t before = live_.fetch_sub(blocks, std::memory_order_acq_rel);
    if (before < blocks) {
        std::abort();  // more blocks released than handed out: the memory is already gone
    }
    if (before == blocks) {
        Destroy();
    }
}

void Arena::Destroy() {
    Chunk* chunk = chunks_;
    this->~Arena();  // the first chunk, which holds the arena, is the last of the list
    while (chunk != nullptr) {
        Chunk* next = chunk->next;
        FreeChunk(chunk);
        chunk = next;
    }
}

// --- Storage forms -----------------------------------------------------------------------------

PObject::Map& PObjectAccess::Materialise(PObject& o) {
    FlatMap& flat = Flat(o);
    auto map = std::make_unique<PObject::Map>();
    FlatEntry* entries = flat.entries();
    for (uint32_t i = 0; i < flat.count; ++i) {
        map->emplace_hint(map->end(), std::piecewise_construct,
                          std::forward_as_tuple(flat.key(i), entries[i].key_size),
                          std::forward_as_tuple(std::move(entries[i].value)));
    }
    for (uint32_t i = 0; i < flat.count; ++i) {
        entries[i].~FlatEntry();  // values moved out: nothing left to release
    }
    Releaser().Free(&flat, flat.arena);
    o.payload_ = map.release();
    return *static_cast<PObject::Map*>(o.payload_);
}

PObject::Array& PObjectAccess::MaterialiseArray(PObject& o) {
    FlatArray& flat = FlatItems(o);
    auto items = std::make_unique<PObject::Array>();
    items->reserve(flat.count);
    PObject* from = flat.items();
    for (uint32_t i = 0; i < flat.count; ++i) {
        items->push_back(std::move(from[i]));
    }
    for (uint32_t i = 0; i < flat.count; ++i) {
        from[i].~PObject();  // moved out: nothing left to release
    }
    Releaser().Free(&flat, flat.arena);  // the block alone: its strings moved with the items
    o.payload_ = items.release();
    return *static_cast<PObject::Array*>(o.payload_);
}

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
            return static_cast<const TextBlock*>(payload_)->size == 0;
        case kArray:
            // A flat array holds at least one item.
            return payload_ == nullptr || (!PObjectAccess::IsFlatArray(*this) &&
                                           static_cast<const Array*>(payload_)->empty());
        case kMap:
            // A flat map holds at least one entry.
            return payload_ == nullptr ||
                   (!PObjectAccess::IsFlat(*this) && static_cast<const Map*>(payload_)->empty());
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
        const TextBlock& text = PObjectAccess::Text(*this);
        return std::string(text.data(), text.size);
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
        if (PObjectAccess::IsFlatArray(*this)) {
            // As for a flat map: the reference handed out must stay valid as a vector's would.
            return PObjectAccess::MaterialiseArray(const_cast<PObject&>(*this));
        }
        return *static_cast<const Array*>(payload_);
    }
    return GetEmptyArray();
}

const PObject::Map& PObject::asMap() const {
    if (type_ == kMap && payload_ != nullptr) {
        if (PObjectAccess::IsFlat(*this)) {
            // The reference handed out must stay valid as a std::map's would: the storage
            // changes form here, once (see the header).
            return PObjectAccess::Materialise(const_cast<PObject&>(*this));
        }
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
    } else if (PObjectAccess::IsFlatArray(*this)) {
        return PObjectAccess::MaterialiseArray(*this);
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
    } else if (PObjectAccess::IsFlat(*this)) {
        return PObjectAccess::Materialise(*this);
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
        // A missing key hands out nothing of this map: the flat form answers that itself.
        if (PObjectAccess::IsFlat(*this) && FindFlat(PObjectAccess::Flat(*this), key) == nullptr) {
            return GetEmptyObject();
        }
        const Map& map = asMap();
        auto it = map.find(key);
        if (it != map.end()) {
            return it->second;
        }
    }
    return GetEmptyObject();
}

const PObject& PObject::operator[](unsigned int index) const {
    if (type_ == kArray) {
        // A missing item hands out nothing of this array: the flat form answers that itself.
        if (PObjectAccess::IsFlatArray(*this) && index >= PObjectAccess::FlatItems(*this).count) {
            return GetEmptyObject();
        }
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
    if (type_ != kMap || payload_ == nullptr) {
        return false;
    }
    if (PObjectAccess::IsFlat(*this)) {
        return FindFlat(PObjectAccess::Flat(*this), key) != nullptr;
    }
    return static_cast<const Map*>(payload_)->count(key) != 0;
}

void PObject::clear() {
    if (payload_ != nullptr && type_ != kInteger) {
        // A tree decoded from a peer may be nested a million levels deep: release it with an
        // explicit work list instead of recursion, so the depth never reaches the call stack.
        // Only children that need a walk of their own go on the list: a received map or array
        // that lives wholly in its arena is released with everything in it in one step (its
        // blocks were counted when it was built), and strings go at once.
        Releaser releaser;
        WorkList pending;
        // Releases `child` here when that needs no walk (adding its arena blocks to the
        // releaser's count instead of paying an atomic step of its own), else moves it to the
        // work list.
        auto release_child =
            [&releaser, &pending ](PObject & child) __attribute__((always_inline)) {
            if (child.type_ == kString) {
                TextBlock* text = static_cast<TextBlock*>(child.payload_);
                releaser.Free(text, text->arena);
            } else if (PObjectAccess::IsFlatArray(child)) {
                FlatArray& flat = PObjectAccess::FlatItems(child);
                releaser.Free(&flat, flat.arena, flat.whole_blocks);
            } else if (child.type_ == kArray && child.payload_ != nullptr) {
                // An array of leaves (a list of names, say) goes here and now.
                Array* items = static_cast<Array*>(child.payload_);
                for (const PObject& item : *items) {
                    if (item.isContainer() && item.payload_ != nullptr) {
                        pending.Push(child);
                        return;
                    }
                }
                for (PObject& item : *items) {
                    if (item.type_ == kString) {
                        TextBlock* text = static_cast<TextBlock*>(item.payload_);
                        releaser.Free(text, text->arena);
                    }
                    item.type_ = kNull;
                    item.payload_ = nullptr;
                }
                delete items;
            } else if (child.isContainer() && child.payload_ != nullptr) {
                if (!PObjectAccess::IsFlat(child) || PObjectAccess::Flat(child).whole_blocks == 0) {
                    pending.Push(child);
                    return;
                }
                FlatMap& flat = PObjectAccess::Flat(child);
                releaser.Free(&flat, flat.arena, flat.whole_blocks);
            }
            // Everything else left is an integer, a null or an empty container.
            child.type_ = kNull;
            child.payload_ = nullptr;
        };
        PObject current;
        current.swap(*this);
        for (;;) {
            switch (current.type_) {
                case kString: {
                    TextBlock* text = static_cast<TextBlock*>(current.payload_);
                    releaser.Free(text, text->arena);
                    break;
                }
                case kArray:
                    if (PObjectAccess::IsFlatArray(current)) {
                        FlatArray& flat = PObjectAccess::FlatItems(current);
                        releaser.Free(&flat, flat.arena, flat.whole_blocks);
                    } else if (current.payload_ != nullptr) {
                        Array* items = static_cast<Array*>(current.payload_);
                        for (PObject& item : *items) {
                            release_child(item);
                        }
                        delete items;
                    }
                    break;
                case kMap:
                    if (current.payload_ == nullptr) {
                        break;
                    }
                    if (PObjectAccess::IsFlat(current)) {
                        FlatMap& flat = PObjectAccess::Flat(current);
                        if (flat.whole_blocks != 0) {
                            releaser.Free(&flat, flat.arena, flat.whole_blocks);
                            break;
                        }
                        FlatEntry* entries = flat.entries();
                        for (uint32_t i = 0; i < flat.count; ++i) {
                            release_child(entries[i].value);
                        }
                        releaser.Free(&flat, flat.arena);
                    } else {
                        Map* map = static_cast<Map*>(current.payload_);
                        for (auto& entry : *map) {
                            release_child(entry.second);
                        }
                        delete map;
                    }
                    break;
                default:
                    break;
            }
            current.type_ = kNull;
            current.payload_ = nullptr;
            if (!pending.Pop(current)) {
                break;
            }
        }
    }
    type_ = kNull;
    payload_ = nullptr;
}

template <>
void PObject::copy<unsigned long long>(const unsigned long long& value) {
    clear();
    type_ = kInteger;
    number_ = value;
}

template <>
void PObject::copy<std::string>(const std::string& value) {
    PObjectAccess::AssignText(*this, nullptr, value.data(), value.size());
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
            case kString: {
                const TextBlock& text = PObjectAccess::Text(from);
                to.payload_ = PObjectAccess::NewText(nullptr, text.data(), text.size);
                to.type_ = kString;
                break;
            }
            case kArray: {
                to.type_ = kArray;
                const ItemView items = PObjectAccess::Items(from);  // either form, read in place
                if (items.size == 0) {
                    break;
                }
                // Sized once, so the addresses on the work list stay valid.
                Array& copies = to.asArray();
                copies.resize(items.size);
                for (size_t i = items.size; i-- > 0;) {
                    pending.emplace_back(&items.data[i], &copies[i]);
                }
                break;
            }
            case kMap: {
                to.type_ = kMap;
                if (from.payload_ == nullptr) {
                    break;
                }
                if (PObjectAccess::IsFlat(from)) {
                    // A flat map copies as one block, keys and all.
                    const FlatMap& source = PObjectAccess::Flat(from);
                    FlatMap* flat = PObjectAccess::NewFlat(nullptr, source.count, source.key_bytes);
                    std::memcpy(flat->keys(), source.keys(), source.key_bytes);
                    to.payload_ = reinterpret_cast<char*>(flat) + 1;
                    for (uint32_t i = source.count; i-- > 0;) {
                        const FlatEntry& entry = source.entries()[i];
                        flat->entries()[i].key_offset = entry.key_offset;
                        flat->entries()[i].key_size = entry.key_size;
                        pending.emplace_back(&entry.value, &flat->entries()[i].value);
                    }
                    break;
                }
                const Map& map = *static_cast<const Map*>(from.payload_);
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
    // Each step is a value still to print, or (value null) the separator/closing text to append;
    // a key, when there is one, goes first.
    struct Step {
        const PObject* value;
        const char* text;
        const char* key;
        size_t key_size;
    };
    std::vector<Step> pending;
    pending.push_back(Step{this, nullptr, nullptr, 0});
    while (!pending.empty()) {
        Step step = pending.back();
        pending.pop_back();
        if (step.key != nullptr) {
            out += '"';
            out.append(step.key, step.key_size);
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
            case kString: {
                const TextBlock& text = PObjectAccess::Text(value);
                out += '"';
                out.append(text.data(), text.size);
                out += '"';
                break;
            }
            case kArray: {
                out += '[';
                pending.push_back(Step{nullptr, "]", nullptr, 0});
                const ItemView items = PObjectAccess::Items(value);
                for (size_t i = items.size; i-- > 0;) {
                    pending.push_back(Step{&items.data[i], nullptr, nullptr, 0});
                    if (i > 0) {
                        pending.push_back(Step{nullptr, ", ", nullptr, 0});
                    }
                }
                break;
            }
            case kMap: {
                out += '{';
                pending.push_back(Step{nullptr, "}", nullptr, 0});
                if (PObjectAccess::IsFlat(value)) {
                    const FlatMap& flat = PObjectAccess::Flat(value);
                    for (uint32_t i = flat.count; i-- > 0;) {
                        const FlatEntry& entry = flat.entries()[i];
                        pending.push_back(Step{&entry.value, nullptr, flat.key(i), entry.key_size});
                        if (i > 0) {
                            pending.push_back(Step{nullptr, ", ", nullptr, 0});
                        }
                    }
                    break;
                }
                const Map& map = value.asMap();
                for (auto it = map.rbegin(); it != map.rend(); ++it) {
                    pending.push_back(
                        Step{&it->second, nullptr, it->first.data(), it->first.size()});
                    if (std::next(it) != map.rend()) {
                        pending.push_back(Step{nullptr, ", ", nullptr, 0});
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
