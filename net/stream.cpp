// PStream: the tagged wire form of a PObject, written into and read from a Channel's rings, with
// its debug trace (one line per tag and value, secrets masked) and the stream's history and
// counters under the stream's own mutex.
#include "s2s_stream.h"

#include <endian.h>
#include <linux/membarrier.h>
#include <sched.h>
#include <sys/syscall.h>
#include <unistd.h>

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

#include <algorithm>
#include <cctype>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <tuple>
#include <typeinfo>

#include "core/pobject_storage.h"
#include "net/log_debug.h"
#include "s2s_logger.h"
#include "s2s_status.h"

namespace S2S {

namespace {

// Debug lines are indented two blanks per level, up to eleven levels; nesting itself is unlimited.
const char* const kIndent[] = {
    "",
    "  ",
    "    ",
    "      ",
    "        ",
    "          ",
    "            ",
    "              ",
    "                ",
    "                  ",
    "                    ",
    "                      ",
};
constexpr int kMaxIndent = 11;

// The byte count of the smallest of 1, 2, 4, 8 that holds the value.
inline unsigned char IntegerLength(unsigned long long value) {
    if ((value >> 8) == 0) {
        return 1;
    }
    if ((value >> 16) == 0) {
        return 2;
    }
    if ((value >> 32) == 0) {
        return 4;
    }
    return 8;
}

// The wire form of a map key: one leading underscore is dropped.
const char* WireKey(const char* key, size_t size, size_t& length) {
    if (size > 0 && key[0] == '_') {
        length = size - 1;
        return key + 1;
    }
    length = size;
    return key;
}

// Task maps carry a password in plain text under "pswd"; other callers name theirs "password"
// and the like. Values under such keys are never written to the log.
bool IsSecretKey(const char* key, size_t length) {
    auto contains = [&](const char* word) {
        size_t n = std::strlen(word);
        for (size_t i = 0; i + n <= length; ++i) {
            size_t j = 0;
            while (j < n && std::tolower(static_cast<unsigned char>(key[i + j])) == word[j]) {
                ++j;
            }
            if (j == n) {
                return true;
            }
        }
        return false;
    };
    return contains("pswd") || contains("passw");
}

constexpr char kMasked[] = "********";

// A barrier on every thread of the process at once (membarrier), so that the thread that edits a
// stream's key path needs no fence of its own. Registered once; unavailable on kernels without it.
bool RegisterHeavyBarrier() {
    long commands = syscall(SYS_membarrier, MEMBARRIER_CMD_QUERY, 0, 0);
    return commands > 0 && (commands & MEMBARRIER_CMD_PRIVATE_EXPEDITED) != 0 &&
           syscall(SYS_membarrier, MEMBARRIER_CMD_REGISTER_PRIVATE_EXPEDITED, 0, 0) == 0;
}

bool HeavyBarrierAvailable() {
    static const bool available = RegisterHeavyBarrier();
    return available;
}

void HeavyBarrier() {
    if (syscall(SYS_membarrier, MEMBARRIER_CMD_PRIVATE_EXPEDITED, 0, 0) != 0) {
        std::abort();  // registered above: failing now would leave an edit unguarded
    }
}

// True when the codec may go straight to the rings: a plain Channel (no step replaced by a
// subclass) and no debug line that the long way would log.
bool Direct(const Channel& channel) {
    return Logger::log_level < Logger::Debug && typeid(channel) == typeid(Channel);
}

constexpr size_t kNoEntry = ~size_t{0};
// Stacks deeper than this are not kept between messages.
constexpr size_t kKeptFrames = 256;

// The wire size (tag included) of `value` when it is a primitive that the direct path writes: 0
// for a container or a string longer than its 16-bit length field.
[[gnu::always_inline]] inline size_t PrimitiveSize(const PObject& value) {
    if (value.isNull()) {
        return 2;
    }
    if (value.isInteger()) {
        return 2 + IntegerLength(PObjectAccess::Number(value));
    }
    if (value.isString()) {
        const size_t size = PObjectAccess::Text(value).size;
        return size <= 0xFFFF ? 3 + size : 0;
    }
    return 0;
}

// Writes the primitive `value` at `at` (PrimitiveSize gave its room).
[[gnu::always_inline]] inline void PutPrimitive(const PObject& value, char* at) {
    if (value.isString()) {
        const TextBlock& text = PObjectAccess::Text(value);
        at[0] = static_cast<char>(PStream::kTagString);
        at[1] = static_cast<char>(text.size >> 8);
        at[2] = static_cast<char>(text.size);
        CopyBytes(at + 3, text.data(), text.size);
    } else if (value.isNull()) {
        at[0] = static_cast<char>(PStream::kTagNull);
        at[1] = 0;
    } else {
        const unsigned long long number = PObjectAccess::Number(value);
        const unsigned char length = IntegerLength(number);
        at[0] = static_cast<char>(PStream::kTagInteger);
        at[1] = static_cast<char>(length);
        // Most significant byte first, stored as one word.
        if (length == 1) {
            at[2] = static_cast<char>(number);
        } else if (length == 2) {
            const uint16_t word = htobe16(static_cast<uint16_t>(number));
            std::memcpy(at + 2, &word, sizeof(word));
        } else if (length == 4) {
            const uint32_t word = htobe32(static_cast<uint32_t>(number));
            std::memcpy(at + 2, &word, sizeof(word));
        } else {
            const uint64_t word = htobe64(number);
            std::memcpy(at + 2, &word, sizeof(word));
        }
    }
}

// Writes the primitive `value` at `at` when it fits before `limit` with `spare` bytes left over:
// its wire size, or 0 (nothing written) for a container, a string longer than its 16-bit length
// field, or too little room. One look at the type, where PrimitiveSize and PutPrimitive take two.
[[gnu::always_inline]] inline size_t PutPrimitiveWithin(const PObject& value, char* at,
                                                        const char* limit, size_t spare) {
    const size_t room = static_cast<size_t>(limit - at);
    size_t wire = 0;
    if (value.isString()) {
        const size_t size = PObjectAccess::Text(value).size;
        wire = 3 + size;
        if (size > 0xFFFF || room < wire + spare) {
            return 0;
        }
    } else if (value.isInteger()) {
        wire = 2 + IntegerLength(PObjectAccess::Number(value));
        if (room < wire + spare) {
            return 0;
        }
    } else if (value.isNull()) {
        wire = 2;
        if (room < wire + spare) {
            return 0;
        }
    } else {
        return 0;
    }
    PutPrimitive(value, at);
    return wire;
}

// Writes the container `value` whole at `at` when it holds only primitives and fits before
// `limit` (its keys and values are never on the key path: nothing can read it meanwhile), and
// moves `at` past it; false, with nothing moved, otherwise.
bool PutLeafContainer(const PObject& value, char*& at, char* limit) {
    char* out = at;
    auto put = [&](const PObject& item) __attribute__((always_inline)) {
        const size_t wire = PutPrimitiveWithin(item, out, limit, 1);  // room for the end tag
        out += wire;
        return wire != 0;
    };
    auto put_entry = [&](const char* name, size_t size, const PObject& item)
        __attribute__((always_inline)) {
        size_t length = 0;
        const char* key = WireKey(name, size, length);
        if (length > 0xFFFF || static_cast<size_t>(limit - out) < 3 + length) {
            return false;
        }
        out[0] = static_cast<char>(PStream::kTagString);
        out[1] = static_cast<char>(length >> 8);
        out[2] = static_cast<char>(length);
        CopyBytes(out + 3, key, length);
        out += 3 + length;
        return put(item);
    };
    if (limit - out < 2) {
        return false;
    }
    *out++ = static_cast<char>(value.isArray() ? PStream::kTagArray : PStream::kTagMap);
    if (value.isArray()) {
        for (const PObject& item : PObjectAccess::Items(value)) {
            if (!put(item)) {
                return false;
            }
        }
    } else if (PObjectAccess::IsFlat(value)) {
        const FlatMap& flat = PObjectAccess::Flat(value);
        for (uint32_t i = 0; i < flat.count; ++i) {
            if (!put_entry(flat.key(i), flat.entries()[i].key_size, flat.entries()[i].value)) {
                return false;
            }
        }
    } else {
        for (const auto& entry : value.asMap()) {
            if (!put_entry(entry.first.data(), entry.first.size(), entry.second)) {
                return false;
            }
        }
    }
    if (out == limit) {
        return false;
    }
    *out++ = static_cast<char>(PStream::kTagEnd);
    at = out;
    return true;
}

// The wire size (tag included) of the primitive value at `value` when it lies whole before `end`;
// 0 for a container, a malformed value or one whose bytes are still to come.
[[gnu::always_inline]] inline size_t PrimitiveWire(const char* value, const char* end) {
    if (end - value < 2) {
        return 0;
    }
    const unsigned char tag = static_cast<unsigned char>(value[0]);
    const unsigned int lead = static_cast<unsigned char>(value[1]);
    size_t wire = 0;
    if (tag == PStream::kTagInteger && lead <= 8) {
        wire = 2 + lead;
    } else if (tag == PStream::kTagNull && lead == 0) {
        wire = 2;
    } else if (tag == PStream::kTagString && end - value >= 3) {
        wire = 3 + ((lead << 8) | static_cast<unsigned char>(value[2]));
    }
    return static_cast<size_t>(end - value) >= wire ? wire : 0;
}

[[gnu::always_inline]] inline size_t TextLength(const char* text, size_t wire_length,
                                                const char* readable_end);

// Stores the primitive value at `value` (PrimitiveWire gave `wire`) into `target`, which is null.
// `end`: the end of the readable bytes around it (the buffered span).
[[gnu::always_inline]] inline void StorePrimitive(const char* value, size_t wire, PObject& target,
                                                  Arena* arena, const char* end) {
    const unsigned char tag = static_cast<unsigned char>(value[0]);
    if (tag == PStream::kTagInteger) {
        // The writer's lengths are 1, 2, 4 and 8 bytes, most significant first.
        const unsigned char* bytes = reinterpret_cast<const unsigned char*>(value) + 2;
        unsigned long long number = 0;
        if (wire == 3) {
            number = bytes[0];
        } else if (wire == 4) {
            number = (static_cast<unsigned int>(bytes[0]) << 8) | bytes[1];
        } else if (wire == 6) {
            uint32_t word;
            std::memcpy(&word, bytes, sizeof(word));
            number = be32toh(word);
        } else if (wire == 10) {
            uint64_t word;
            std::memcpy(&word, bytes, sizeof(word));
            number = be64toh(word);
        } else {
            for (size_t i = 0; i + 2 < wire; ++i) {
                number = (number << 8) + bytes[i];
            }
        }
        PObjectAccess::SetInteger(target, number);
    } else if (tag == PStream::kTagString) {
        PObjectAccess::SetText(target, arena, value + 3, TextLength(value + 3, wire - 3, end));
    }
}

// The length of a received string as it is kept: up to its first NUL. Short ones are looked at
// here rather than through a call; the bytes up to `readable_end` may be read past the text (they
// are buffered bytes of the same ring), which lets one or two vector compares settle most texts.
[[gnu::always_inline]] inline size_t TextLength(const char* text, size_t wire_length,
                                                const char* readable_end) {
#if defined(__SSE2__)
    const size_t readable = static_cast<size_t>(readable_end - text);
    if (wire_length <= 32 && readable >= 32) {
        const __m128i zero = _mm_setzero_si128();
        const __m128i low = _mm_loadu_si128(reinterpret_cast<const __m128i*>(text));
        const __m128i high = _mm_loadu_si128(reinterpret_cast<const __m128i*>(text + 16));
        // Bit i: byte i is NUL; the bit at wire_length stands for the end of the text.
        const uint64_t zeros =
            static_cast<uint64_t>(
                static_cast<uint32_t>(_mm_movemask_epi8(_mm_cmpeq_epi8(low, zero)))) |
            (static_cast<uint64_t>(
                 static_cast<uint32_t>(_mm_movemask_epi8(_mm_cmpeq_epi8(high, zero))))
             << 16) |
            (uint64_t{1} << wire_length);
        return static_cast<size_t>(__builtin_ctzll(zeros));
    }
    if (wire_length <= 16 && readable >= 16) {
        const __m128i bytes = _mm_loadu_si128(reinterpret_cast<const __m128i*>(text));
        const uint32_t zeros =
            static_cast<uint32_t>(_mm_movemask_epi8(_mm_cmpeq_epi8(bytes, _mm_setzero_si128()))) |
            (uint32_t{1} << wire_length);
        return static_cast<size_t>(__builtin_ctz(zeros));
    }
#else
    (void)readable_end;
#endif
    if (wire_length > 64) {
        return strnlen(text, wire_length);
    }
    // Eight bytes at a time: a word holds a zero byte exactly when HasZero is non-zero. The last
    // word is read where it ends with the text (overlapping the one before), so a text without
    // NUL, the usual case, is settled without a byte loop.
    constexpr uint64_t kOnes = 0x0101010101010101ULL;
    constexpr uint64_t kHighs = 0x8080808080808080ULL;
    auto has_zero = [](const char* at) {
        uint64_t word;
        std::memcpy(&word, at, sizeof(word));
        return ((word - kOnes) & ~word & kHighs) != 0;
    };
    size_t n = 0;
    if (wire_length >= 8) {
        for (; n + 8 <= wire_length && !has_zero(text + n); n += 8) {
        }
        if (n + 8 > wire_length && !has_zero(text + wire_length - 8)) {
            return wire_length;
        }
    } else if (wire_length >= 4) {
        // Two overlapping half words cover four to seven bytes.
        auto has_zero_half = [](const char* at) {
            uint32_t half;
            std::memcpy(&half, at, sizeof(half));
            return ((half - 0x01010101U) & ~half & 0x80808080U) != 0;
        };
        if (!has_zero_half(text) && !has_zero_half(text + wire_length - 4)) {
            return wire_length;
        }
    }
    while (n < wire_length && text[n] != '\0') {
        ++n;
    }
    return n;
}

// An entry of a flat map still being decoded; its key is in the scratch's key bytes.
struct PendingEntry {
    PObject value;
    size_t key_offset = 0;
    uint32_t key_size = 0;
};

// The key bytes of the flat maps open in a decode: a byte buffer whose append is inline (a key
// is appended for every map entry received).
class KeyBytes {
  public:
    size_t size() const { return size_; }
    size_t capacity() const { return capacity_; }
    const char* data() const { return bytes_.get(); }
    void clear() { size_ = 0; }
    // REQUIRES: size <= size().
    void resize(size_t size) { size_ = size; }
    void append(const char* key, size_t length) {
        if (capacity_ - size_ < length) {
            Grow(length);
        }
        CopyBytes(bytes_.get() + size_, key, length);
        size_ += length;
    }
    void Release() {
        bytes_.reset();
        size_ = 0;
        capacity_ = 0;
    }

  private:
    void Grow(size_t length) {
        size_t capacity = std::max<size_t>(256, std::max(capacity_ * 2, size_ + length));
        std::unique_ptr<char[]> bytes(new char[capacity]);
        if (size_ > 0) {
            std::memcpy(bytes.get(), bytes_.get(), size_);
        }
        bytes_ = std::move(bytes);
        capacity_ = capacity;
    }
    std::unique_ptr<char[]> bytes_;
    size_t size_ = 0;
    size_t capacity_ = 0;
};

// The entries and keys of the flat maps open in a decode, innermost last (kept by the thread
// between messages, see ThreadKept); a large message's room is given back afterwards.
struct DecodeScratch {
    std::vector<PendingEntry> entries;
    KeyBytes keys;
    void Reset() {
        entries.clear();
        keys.clear();
        if (entries.capacity() > kKeptEntries) {
            std::vector<PendingEntry>().swap(entries);
        }
        if (keys.capacity() > kKeptEntries * 16) {
            keys.Release();
        }
    }
    static constexpr size_t kKeptEntries = 1024;
};

// The working storage of a decode or encode that the thread keeps between messages, so that a
// transfer does not allocate it again; or, when a transfer runs inside another on the same thread
// (a channel subclass that sends or receives in its own steps), a fresh one of its own.
template <typename T>
class ThreadKept {
  public:
    ThreadKept() : nested_(Busy()) { Busy() = true; }
    ~ThreadKept() {
        if (!nested_) {
            Busy() = false;
        }
    }
    ThreadKept(const ThreadKept&) = delete;
    ThreadKept& operator=(const ThreadKept&) = delete;
    T& get() { return nested_ ? own_ : Shared(); }

  private:
    static T& Shared() {
        static thread_local T kept;
        return kept;
    }
    static bool& Busy() {
        static thread_local bool busy = false;
        return busy;
    }
    const bool nested_;
    T own_;
};

}  // namespace

// One open container of the decoder. The decoder keeps these on the heap so that nesting depth
// never reaches the call stack. `pending` is set while the container's current entry is being
// read: for an array that entry is its last element, which is dropped again if it fails.
// `key_done` is set when a map entry has been read whole but its key is still on the history: the
// pop is owed, and the next key takes its place under one lock (ReplaceKey).
// A map the decoder creates is built flat (neither `array` nor `map`): its entries collect in the
// scratch from `first` (keys from `key_start`) and leave it as one block at its end tag, into
// `target`, or, when that is null, into the value of the scratch entry `owner` (scratch entries
// move as the scratch grows, so they are named by index).
struct PStream::Frame {
    std::vector<PObject>* array;
    std::map<std::string, PObject>* map;
    bool pending;
    bool key_done;
    PObject* target;
    size_t owner;
    size_t first;
    size_t key_start;
    bool flat() const { return array == nullptr && map == nullptr; }
};

PStream::PStream() {
    pthread_mutex_init(&mutex_, nullptr);
}

PStream::~PStream() {
    pthread_mutex_destroy(&mutex_);
}

int PStream::Send(Channel& channel, const PObject& object) {
    int ret = SendObject(channel, object);
    if (ret < 0) {
        DumpHistory();
        ClearHistory();
        return ret;
    }
    ret = channel.FlushWrite(0);
    if (ret < 0) {
        Logger::LogMsg(Logger::Warning, "[WARNING] s2s_stream.cpp(%d): Channel: %d\n", __LINE__,
                       ret);
        ClearHistory();
        return kStatusIOError;
    }
    ClearHistory();
    return kStatusSuccessful;
}

int PStream::Recv(Channel& channel, PObject& object) {
    int ret = RecvObject(channel, object);
    if (ret < 0) {
        DumpHistory();
    }
    ClearHistory();
    return ret < 0 ? ret : kStatusSuccessful;
}

int PStream::SendObject(Channel& channel, const PObject& object) {
    return Encode(channel, &object, nullptr, nullptr);
}

int PStream::RecvObject(Channel& channel, PObject& object) {
    return Decode(channel, &object, false, 0, nullptr, nullptr);
}

int PStream::RecvTag(Channel& channel, unsigned char& tag) {
    if (!span_) {
        SetDirect(channel);
    }
    int ret = ReadByte(channel, tag);
    return ret < 0 ? ChannelFailure(ret) : kStatusSuccessful;
}

int PStream::RecvDispatch(Channel& channel, unsigned char tag, PObject& object) {
    return Decode(channel, &object, true, tag, nullptr, nullptr);
}

int PStream::Send(Channel& channel, unsigned long long value) {
    if (!span_) {
        SetDirect(channel);
    }
    ResetStatus();
    // Tag, length byte and value bytes go to the channel together.
    unsigned char length = IntegerLength(value);
    unsigned char bytes[2 + 8] = {kTagInteger, length};
    for (int i = length - 1; i >= 0; --i) {
        bytes[2 + i] = static_cast<unsigned char>(value >> (8 * (length - 1 - i)));
    }
    int ret = WriteBytes(channel, reinterpret_cast<const char*>(bytes), 2u + length);
    if (ret < 0) {
        return ChannelFailure(ret);
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s%llu\n", __LINE__, Indent(), value);
    return kStatusSuccessful;
}

int PStream::Recv(Channel& channel, unsigned long long& value) {
    ResetStatus();
    if (!span_) {
        SetDirect(channel);
    }
    if (direct_) {
        // Length byte and value bytes are usually buffered together: one look at the ring.
        const char* at = channel.BufferedRun(1);
        if (at != nullptr) {
            unsigned int length = static_cast<unsigned char>(at[0]);
            if (length <= 8 && channel.BufferedRun(1 + length) != nullptr) {
                unsigned long long result = 0;
                for (unsigned int i = 1; i <= length; ++i) {
                    result = (result << 8) + static_cast<unsigned char>(at[i]);
                }
                channel.Consume(1 + length);
                received_ += 1 + length;
                value = result;
                return kStatusSuccessful;  // no debug line is due on this path
            }
        }
    }
    unsigned char length = 0;
    int ret = ReadByte(channel, length);
    if (ret < 0) {
        return ChannelFailure(ret);
    }
    // A conforming writer never uses more than 8 bytes; reading more would lose the high bytes.
    if (length > 8) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_stream.cpp(%d): integer length %u is more than 8 bytes\n",
                       __LINE__, length);
        return kStatusProtocolError;
    }
    received_ += 1 + length;
    unsigned char bytes[8];
    if (length > 0) {
        ret = ReadBytes(channel, reinterpret_cast<char*>(bytes), length);
        if (ret < 0) {
            return ChannelFailure(ret);
        }
    }
    unsigned long long result = 0;
    for (unsigned i = 0; i < length; ++i) {
        result = (result << 8) + bytes[i];
    }
    value = result;
    S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s%llu\n", __LINE__, Indent(), value);
    return kStatusSuccessful;
}

int PStream::Send(Channel& channel, const std::string& value) {
    if (!span_) {
        SetDirect(channel);
    }
    ResetStatus();
    int ret = WriteString(channel, value.data(), value.size());
    if (ret < 0) {
        return ChannelFailure(ret);
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s\"%s\"\n", __LINE__, Indent(),
                  LoggedValue(value.c_str()));
    return kStatusSuccessful;
}

int PStream::Recv(Channel& channel, std::string& value) {
    // Read aside first, so that a failed read leaves the caller's string as it was.
    std::string text;
    int ret = RecvText(channel, text, false);
    if (ret >= 0) {
        value.swap(text);
    }
    return ret;
}

int PStream::RecvText(Channel& channel, std::string& text, bool is_key) {
    ResetStatus();
    // Only the bytes up to the first NUL are kept, as the format always did.
    if (!span_) {
        SetDirect(channel);
    }
    const char* at = direct_ ? channel.BufferedRun(2) : nullptr;
    unsigned int length = at == nullptr ? 0
                                        : (static_cast<unsigned char>(at[0]) << 8) |
                                              static_cast<unsigned char>(at[1]);
    if (at != nullptr && channel.BufferedRun(2 + length) != nullptr) {
        // Length and body buffered in one piece: one copy, straight from the ring.
        received_ += 2 + length;
        text.assign(at + 2, strnlen(at + 2, length));
        channel.Consume(2 + length);
    } else {
        unsigned short wire_length = 0;
        int ret = ReadInt16(channel, wire_length);
        if (ret < 0) {
            return ChannelFailure(ret);
        }
        length = wire_length;
        received_ += 2 + length;
        text.resize(length);
        if (length > 0) {
            ret = ReadBytes(channel, &text[0], length);
            if (ret < 0) {
                return ChannelFailure(ret);
            }
        }
        text.resize(strnlen(text.data(), length));
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s\"%s\"\n", __LINE__, Indent(),
                  is_key ? text.c_str() : LoggedValue(text.c_str()));
    return kStatusSuccessful;
}

int PStream::SendNull(Channel& channel) {
    if (!span_) {
        SetDirect(channel);
    }
    ResetStatus();
    static const char kNull[2] = {kTagNull, 0};
    int ret = WriteBytes(channel, kNull, sizeof(kNull));
    return ret < 0 ? ChannelFailure(ret) : kStatusSuccessful;
}

int PStream::Send(Channel& channel, const std::vector<PObject>& array) {
    return Encode(channel, nullptr, &array, nullptr);
}

int PStream::Recv(Channel& channel, std::vector<PObject>& array) {
    return Decode(channel, nullptr, false, 0, &array, nullptr);
}

int PStream::Send(Channel& channel, const std::map<std::string, PObject>& map) {
    return Encode(channel, nullptr, nullptr, &map);
}

int PStream::Recv(Channel& channel, std::map<std::string, PObject>& map) {
    return Decode(channel, nullptr, false, 0, nullptr, &map);
}

int PStream::Skip(Channel& /*channel*/, unsigned char /*tag*/) {
    return kStatusProtocolError;
}

void PStream::GetVersion(unsigned& major, unsigned& minor, unsigned& patch) {
    major = 1;
    minor = 0;
    patch = 0;
}

void PStream::UpdateStatus(unsigned long long a, unsigned long long b) {
    pthread_mutex_lock(&mutex_);
    status_a_.store(a, std::memory_order_relaxed);
    status_b_.store(b, std::memory_order_relaxed);
    pthread_mutex_unlock(&mutex_);
}

void PStream::GetStatus(std::string& path, unsigned long long& a, unsigned long long& b) {
    Watch();
    path = GetHistory();
    a = status_a_.load(std::memory_order_relaxed);
    b = status_b_.load(std::memory_order_relaxed);
    Unwatch();
}

std::string PStream::GetHistory() {
    return history_;
}

void PStream::DumpHistory() {
    Watch();
    Logger::LogMsg(Logger::Error, "[ERROR] s2s_stream.cpp(%d): Error stack: %s\n", __LINE__,
                   GetHistory().c_str());
    Unwatch();
}

void PStream::ClearHistory() {
    // The usual end of a whole message leaves nothing to clear: then no edit is needed, as for
    // ResetStatus.
    if (history_.empty() && marks_.empty() && status_a_.load(std::memory_order_relaxed) == 0 &&
        status_b_.load(std::memory_order_relaxed) == 0) {
        depth_ = 0;
        return;
    }
    bool locked = BeginEdit();
    history_.clear();
    marks_.clear();
    status_a_.store(0, std::memory_order_relaxed);
    status_b_.store(0, std::memory_order_relaxed);
    EndEdit(locked);
    depth_ = 0;
}

void PStream::SetDefaultRecvLocation(const std::string& path) {
    recv_location_ = path;
}

void PStream::SetRecvLimits(size_t max_bytes, unsigned int max_depth) {
    max_recv_bytes_ = max_bytes;
    max_recv_depth_ = max_depth;
}

bool PStream::BeginEdit() {
    if (span_) {
        if (span_locked_) {
            pthread_mutex_lock(&mutex_);
        }
        return span_locked_;
    }
    editing_.store(true, std::memory_order_relaxed);
    // With process-wide barriers a reader forces the fence on this thread; without, pay it here.
    if (HeavyBarrierAvailable()) {
        std::atomic_signal_fence(std::memory_order_seq_cst);
    } else {
        std::atomic_thread_fence(std::memory_order_seq_cst);
    }
    if (watchers_.load(std::memory_order_relaxed) == 0) {
        return false;
    }
    editing_.store(false, std::memory_order_release);
    pthread_mutex_lock(&mutex_);
    return true;
}

void PStream::EndEdit(bool locked) {
    if (locked) {
        pthread_mutex_unlock(&mutex_);
    } else if (!span_) {
        editing_.store(false, std::memory_order_release);
    } else if (watchers_.load(std::memory_order_relaxed) != 0) {
        LockSpan();  // the edit is whole: let the reader in
    }
}

void PStream::SetDirect(const Channel& channel) {
    direct_ = Direct(channel);
}

void PStream::OpenSpan(const Channel& channel) {
    SetDirect(channel);
    span_ = true;
    span_locked_ = false;
    editing_.store(true, std::memory_order_relaxed);
    if (HeavyBarrierAvailable()) {
        std::atomic_signal_fence(std::memory_order_seq_cst);
    } else {
        std::atomic_thread_fence(std::memory_order_seq_cst);
    }
    if (watchers_.load(std::memory_order_relaxed) != 0) {
        LockSpan();
    }
}

void PStream::LockSpan() {
    span_locked_ = true;
    editing_.store(false, std::memory_order_release);
}

void PStream::CloseSpan() {
    if (span_ && !span_locked_) {
        editing_.store(false, std::memory_order_release);
    }
    span_ = false;
    span_locked_ = false;
}

// Around a channel call that may wait: the span ends first, so that a reader finds the path
// whole meanwhile, and opens again after.
struct PStream::Parked {
    PStream& stream;
    const Channel& channel;
    const bool was_open;
    Parked(PStream& s, const Channel& c) : stream(s), channel(c), was_open(s.span_) {
        if (was_open) {
            stream.CloseSpan();
        }
    }
    ~Parked() {
        if (was_open) {
            stream.OpenSpan(channel);
        }
    }
    Parked(const Parked&) = delete;
    Parked& operator=(const Parked&) = delete;
};

void PStream::Watch() {
    watchers_.fetch_add(1, std::memory_order_seq_cst);
    if (HeavyBarrierAvailable()) {
        HeavyBarrier();
    }
    while (editing_.load(std::memory_order_acquire)) {
        sched_yield();  // an unlocked edit is a few instructions long
    }
    pthread_mutex_lock(&mutex_);
}

void PStream::Unwatch() {
    pthread_mutex_unlock(&mutex_);
    watchers_.fetch_sub(1, std::memory_order_release);
}

int PStream::ReadByte(Channel& channel, unsigned char& byte) {
    if (direct_ && channel.ReadBuffered(reinterpret_cast<char*>(&byte), 1)) {
        return 0;
    }
    Parked parked(*this, channel);
    return channel.ReadByte(&byte);
}

int PStream::ReadInt16(Channel& channel, unsigned short& value) {
    unsigned char b[2];
    if (direct_ && channel.ReadBuffered(reinterpret_cast<char*>(b), 2)) {
        value = static_cast<unsigned short>((b[0] << 8) | b[1]);
        return 0;
    }
    Parked parked(*this, channel);
    return channel.ReadInt16(&value);
}

int PStream::ReadBytes(Channel& channel, char* dst, unsigned int len) {
    if (direct_ && channel.ReadBuffered(dst, len)) {
        return 0;
    }
    Parked parked(*this, channel);
    return channel.Read(dst, len);
}

int PStream::WriteByte(Channel& channel, unsigned char byte) {
    if (direct_ && channel.WriteBuffered(reinterpret_cast<const char*>(&byte), 1)) {
        return 0;
    }
    Parked parked(*this, channel);
    return channel.WriteByte(byte);
}

// Writes `len` bytes in pieces the channel accepts (one Write carries at most its capacity).
int PStream::WriteBytes(Channel& channel, const char* src, size_t len) {
    if (len <= UINT_MAX && direct_ && channel.WriteBuffered(src, static_cast<unsigned int>(len))) {
        return 0;
    }
    Parked parked(*this, channel);
    const size_t step = std::max(1u, channel.GetCapacity());
    for (size_t done = 0; done < len; done += step) {
        int ret = channel.Write(src + done, static_cast<unsigned int>(std::min(step, len - done)));
        if (ret < 0) {
            return ret;
        }
    }
    return 0;
}

// A string value: tag 0x10, the low 16 bits of the length, then every byte (the format's own
// limit, which senders respect). Short strings reach the channel in one piece with their header.
int PStream::WriteString(Channel& channel, const char* data, size_t len) {
    char* room =
        len <= 0xFFFF && direct_ ? channel.WriteRoom(static_cast<unsigned int>(3 + len)) : nullptr;
    if (room != nullptr) {
        room[0] = static_cast<char>(kTagString);
        room[1] = static_cast<char>((len >> 8) & 0xFF);
        room[2] = static_cast<char>(len & 0xFF);
        CopyBytes(room + 3, data, len);
        channel.Commit(static_cast<unsigned int>(3 + len));
        return 0;
    }
    char head[64] = {static_cast<char>(kTagString), static_cast<char>((len >> 8) & 0xFF),
                     static_cast<char>(len & 0xFF)};
    if (len <= sizeof(head) - 3) {
        std::memcpy(head + 3, data, len);
        return WriteBytes(channel, head, 3 + len);
    }
    int ret = WriteBytes(channel, head, 3);
    return ret < 0 ? ret : WriteBytes(channel, data, len);
}

int PStream::ChannelFailure(int status) {
    Logger::LogMsg(Logger::Warning, "[WARNING] s2s_stream.cpp(%d): Channel: %d\n", __LINE__,
                   status);
    return kStatusIOError;
}

void PStream::ResetStatus() {
    // Every primitive resets the counters. When both already read 0 the reset changes nothing, so
    // the common case skips the lock; a concurrent UpdateStatus is simply ordered after it.
    if (status_a_.load(std::memory_order_relaxed) == 0 &&
        status_b_.load(std::memory_order_relaxed) == 0) {
        return;
    }
    UpdateStatus(0, 0);
}

void PStream::PushKey(const char* key, size_t length) {
    bool locked = BeginEdit();
    if (!marks_.empty()) {
        history_ += '.';
    }
    marks_.push_back(history_.size());
    history_.append(key, length);
    EndEdit(locked);
}

void PStream::ReplaceKey(const char* key, size_t length) {
    bool locked = BeginEdit();
    if (!marks_.empty()) {
        history_.resize(marks_.back());
        history_.append(key, length);
    }
    EndEdit(locked);
}

void PStream::PopKey() {
    bool locked = BeginEdit();
    if (!marks_.empty()) {
        size_t start = marks_.back();
        marks_.pop_back();
        // Below the top level the key is preceded by its joining dot, which goes with it.
        history_.resize(marks_.empty() ? 0 : start - 1);
    }
    EndEdit(locked);
}

const char* PStream::LoggedValue(const char* value) const {
    if (marks_.empty()) {
        return value;
    }
    size_t start = marks_.back();
    return IsSecretKey(history_.data() + start, history_.size() - start) ? kMasked : value;
}

const char* PStream::Indent() const {
    return kIndent[std::min(std::max(depth_, 0), kMaxIndent)];
}

int PStream::Encode(Channel& channel, const PObject* object, const std::vector<PObject>* array,
                    const std::map<std::string, PObject>* map) {
    // Containers are walked with an explicit stack, like the decoder, so that any tree the
    // decoder accepted can be sent on again whatever its depth.
    // An array's walk has neither `map` nor `flat` set; it reads the items in either of the
    // array's forms.
    struct Walk {
        const PObject* items;
        size_t count;
        size_t index;  // of the array, or of the flat map
        const std::map<std::string, PObject>* map;
        std::map<std::string, PObject>::const_iterator next;
        bool key_pushed;
        const FlatMap* flat;  // a map still in its flat form (never turned into a std::map here)
    };
    // The walk's stack is kept by the thread between messages; a deep message's room is given
    // back afterwards.
    ThreadKept<std::vector<Walk>> kept_stack;
    std::vector<Walk>& stack = kept_stack.get();
    stack.clear();
    OpenSpan(channel);
    struct SpanEnd {
        PStream& stream;
        std::vector<Walk>& stack;
        ~SpanEnd() {
            stream.CloseSpan();
            if (stack.capacity() > kKeptFrames) {
                std::vector<Walk>().swap(stack);
            }
        }
    } span_end{*this, stack};
    auto open_array = [&](ItemView a) {
        int ret = WriteByte(channel, kTagArray);
        if (ret < 0) {
            return ChannelFailure(ret);
        }
        S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s[\n", __LINE__, Indent());
        ++depth_;
        stack.push_back(Walk{a.data, a.size, 0, nullptr, {}, false, nullptr});
        return 0;
    };
    auto open_map = [&](const std::map<std::string, PObject>& m) {
        int ret = WriteByte(channel, kTagMap);
        if (ret < 0) {
            return ChannelFailure(ret);
        }
        S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s{\n", __LINE__, Indent());
        ++depth_;
        stack.push_back(Walk{nullptr, 0, 0, &m, m.begin(), false, nullptr});
        return 0;
    };
    auto open_flat = [&](const FlatMap& flat) {
        int ret = WriteByte(channel, kTagMap);
        if (ret < 0) {
            return ChannelFailure(ret);
        }
        S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s{\n", __LINE__, Indent());
        ++depth_;
        stack.push_back(Walk{nullptr, 0, 0, nullptr, {}, false, &flat});
        return 0;
    };

    // Map entries whose value is a primitive, written straight into the free room of the ring
    // while it lasts: the counterpart of the decoder's run (the last key goes on the history
    // once; no debug line is due). False when not one entry fitted.
    auto entry_run = [&](Walk& top) {
        unsigned int room = 0;
        char* const start = channel.WriteSpan(room);
        char* const limit = start + room;
        char* at = start;
        const char* last_key = nullptr;
        size_t last_size = 0;
        for (;;) {
            const PObject* entry_value;
            const char* key;
            size_t length = 0;
            if (top.flat != nullptr) {
                if (top.index == top.flat->count) {
                    break;
                }
                const FlatEntry& entry = top.flat->entries()[top.index];
                key = WireKey(top.flat->key(static_cast<uint32_t>(top.index)), entry.key_size,
                              length);
                entry_value = &entry.value;
            } else {
                if (top.next == top.map->end()) {
                    break;
                }
                key = WireKey(top.next->first.data(), top.next->first.size(), length);
                entry_value = &top.next->second;
            }
            const PObject& current = *entry_value;
            if (length > 0xFFFF || static_cast<size_t>(limit - at) < 3 + length) {
                break;  // no room
            }
            char* const entry_start = at;
            at[0] = static_cast<char>(kTagString);
            at[1] = static_cast<char>(length >> 8);
            at[2] = static_cast<char>(length);
            CopyBytes(at + 3, key, length);
            at += 3 + length;
            if (const size_t value_wire = PutPrimitiveWithin(current, at, limit, 0);
                value_wire != 0) {
                at += value_wire;
            } else if (!current.isContainer() || !PutLeafContainer(current, at, limit)) {
                at = entry_start;
                break;  // a container of containers (the general loop opens it), a string
                        // too long for its length field, or no room
            }
            last_key = key;
            last_size = length;
            if (top.flat != nullptr) {
                ++top.index;
            } else {
                ++top.next;
            }
        }
        if (at == start) {
            return false;
        }
        channel.Commit(static_cast<unsigned int>(at - start));
        ResetStatus();
        // At the map's end the key would only be taken off again before the end tag; when the
        // next key fits the ring, the general loop writes it at once (no wait) and puts it on
        // the path in this key's place. Nothing can read the path in between.
        if (top.flat != nullptr ? top.index == top.flat->count : top.next == top.map->end()) {
            return true;
        }
        size_t next_length = 0;
        if (top.flat != nullptr) {
            WireKey(top.flat->key(static_cast<uint32_t>(top.index)),
                    top.flat->entries()[top.index].key_size, next_length);
        } else {
            WireKey(top.next->first.data(), top.next->first.size(), next_length);
        }
        if (next_length <= 0xFFFF && static_cast<size_t>(limit - at) >= 3 + next_length) {
            return true;
        }
        if (top.key_pushed) {
            ReplaceKey(last_key, last_size);
        } else {
            PushKey(last_key, last_size);
            top.key_pushed = true;
        }
        return true;
    };

    // Array elements that are primitives, or maps of primitive entries written from their tag
    // to their end tag, in place of the general loop's steps while the ring has room: the
    // counterpart of the decoder's run. True when it wrote at least one element or map tag.
    auto elements_run = [&](size_t array_walk) {
        for (bool progress = false;; progress = true) {
            Walk& items = stack[array_walk];
            if (items.index == items.count) {
                return progress;
            }
            const PObject& element = items.items[items.index];
            if (const size_t wire = PrimitiveSize(element); wire != 0) {
                char* room = channel.WriteRoom(static_cast<unsigned int>(wire));
                if (room == nullptr) {
                    return progress;
                }
                PutPrimitive(element, room);
                channel.Commit(static_cast<unsigned int>(wire));
                ResetStatus();
                ++items.index;
                continue;
            }
            if (element.isContainer()) {
                // A container of primitives goes whole.
                unsigned int room_size = 0;
                char* const start = channel.WriteSpan(room_size);
                char* at = start;
                if (start != nullptr && PutLeafContainer(element, at, start + room_size)) {
                    channel.Commit(static_cast<unsigned int>(at - start));
                    ResetStatus();
                    ++items.index;
                    continue;
                }
            }
            char* room = channel.WriteRoom(1);
            if (!element.isMap() || room == nullptr) {
                return progress;
            }
            *room = static_cast<char>(kTagMap);
            channel.Commit(1);
            ++items.index;
            ++depth_;
            // The map's walk goes on the stack only if the map stays open.
            Walk map{nullptr, 0, 0, nullptr, {}, false, nullptr};
            if (PObjectAccess::IsFlat(element)) {
                map.flat = &PObjectAccess::Flat(element);
            } else {
                map.map = &element.asMap();
                map.next = map.map->begin();
            }
            entry_run(map);
            room = channel.WriteRoom(1);
            if (room == nullptr ||
                (map.flat != nullptr ? map.index != map.flat->count : map.next != map.map->end())) {
                stack.push_back(map);
                return true;
            }
            if (map.key_pushed) {
                PopKey();
            }
            *room = static_cast<char>(kTagEnd);
            channel.Commit(1);
            --depth_;
        }
    };

    int ret = 0;
    if (array != nullptr) {
        ret = open_array(ItemView{array->data(), array->size()});
    } else if (map != nullptr) {
        ret = open_map(*map);
    }
    const PObject* value = object;
    while (ret >= 0) {
        if (value != nullptr) {
            const PObject& current = *value;
            value = nullptr;
            if (current.isNull()) {
                ret = SendNull(channel);
            } else if (current.isInteger()) {
                ret = Send(channel, current.asUInt64());
            } else if (current.isString()) {
                // Written from the value's own bytes, without a copy.
                const TextBlock& text = PObjectAccess::Text(current);
                ResetStatus();
                ret = WriteString(channel, text.data(), text.size);
                if (ret < 0) {
                    ret = ChannelFailure(ret);
                } else {
                    S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s\"%s\"\n", __LINE__, Indent(),
                                  LoggedValue(text.data()));
                }
            } else if (current.isMap()) {
                ret = PObjectAccess::IsFlat(current) ? open_flat(PObjectAccess::Flat(current))
                                                     : open_map(current.asMap());
                continue;
            } else if (current.isArray()) {
                ret = open_array(PObjectAccess::Items(current));
                continue;
            } else {
                return kStatusInterrupted;  // unknown type code: nothing is written
            }
            if (ret < 0) {
                break;
            }
        }
        if (stack.empty()) {
            return kStatusSuccessful;
        }
        Walk& top = stack.back();
        const bool is_array = top.map == nullptr && top.flat == nullptr;
        bool at_end = is_array              ? top.index == top.count
                      : top.flat != nullptr ? top.index == top.flat->count
                                            : top.next == top.map->end();
        // The previous value went out whole: its key leaves the history, at once before the end
        // tag, or replaced by the next key (one lock for both) once that key is written.
        if (at_end && top.key_pushed) {
            PopKey();
            top.key_pushed = false;
        }
        if (at_end) {
            ret = WriteByte(channel, kTagEnd);
            if (ret < 0) {
                return ChannelFailure(ret);
            }
            --depth_;
            S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s%s\n", __LINE__, Indent(),
                          is_array ? "]" : "}");
            stack.pop_back();
            continue;
        }
        if (is_array) {
            if (direct_ && !span_locked_ && elements_run(stack.size() - 1)) {
                continue;  // a map may have been left open: the loop looks again
            }
            value = &top.items[top.index++];
            continue;
        }
        if (direct_ && !span_locked_ && entry_run(top)) {
            continue;
        }
        size_t length = 0;
        const char* key;
        if (top.flat != nullptr) {
            const FlatEntry& entry = top.flat->entries()[top.index];
            key = WireKey(top.flat->key(static_cast<uint32_t>(top.index)), entry.key_size, length);
        } else {
            key = WireKey(top.next->first.data(), top.next->first.size(), length);
        }
        ret = SendKey(channel, key, length);
        if (ret < 0) {
            if (top.key_pushed) {
                PopKey();
                top.key_pushed = false;
            }
            break;
        }
        if (top.key_pushed) {
            ReplaceKey(key, length);
        } else {
            PushKey(key, length);
            top.key_pushed = true;
        }
        if (top.flat != nullptr) {
            value = &top.flat->entries()[top.index++].value;
        } else {
            value = &top.next->second;
            ++top.next;
        }
    }
    // A failure leaves the key path of the failing value on the history.
    return ret;
}

int PStream::SendKey(Channel& channel, const char* key, size_t length) {
    // Keys are strings on the wire; written here without building a copy of the key.
    ResetStatus();
    int ret = WriteString(channel, key, length);
    if (ret < 0) {
        return ChannelFailure(ret);
    }
    S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s\"%.*s\"\n", __LINE__, Indent(),
                  static_cast<int>(length), key);
    return kStatusSuccessful;
}

int PStream::Decode(Channel& channel, PObject* slot, bool have_tag, unsigned char tag,
                    std::vector<PObject>* array, std::map<std::string, PObject>* map) {
    ThreadKept<DecodeScratch> kept_scratch;
    DecodeScratch& scratch = kept_scratch.get();
    std::vector<PendingEntry>& entries = scratch.entries;
    KeyBytes& keys = scratch.keys;
    ThreadKept<std::vector<Frame>> kept_stack;
    std::vector<Frame>& stack = kept_stack.get();
    stack.clear();
    // Leaves the scratch empty, the key path readable and lets go of the message's arena on
    // every way out.
    OpenSpan(channel);
    struct Cleanup {
        PStream& stream;
        DecodeScratch& scratch;
        std::vector<Frame>& stack;
        Arena* arena = nullptr;
        ~Cleanup() {
            stream.CloseSpan();
            scratch.Reset();
            if (stack.capacity() > kKeptFrames) {
                std::vector<Frame>().swap(stack);
            }
            if (arena != nullptr) {
                arena->Finish();
            }
        }
    } cleanup{*this, scratch, stack};
    auto arena = [&cleanup] {
        if (cleanup.arena == nullptr) {
            cleanup.arena = Arena::Create();
        }
        return cleanup.arena;
    };

    auto open = [&](std::vector<PObject>* a, std::map<std::string, PObject>* m) {
        S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s%s\n", __LINE__, Indent(),
                      a != nullptr ? "[" : "{");
        ++depth_;
        stack.push_back(Frame{a, m, false, false, nullptr, kNoEntry, 0, 0});
    };
    auto open_flat = [&](PObject* target, size_t owner) {
        S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s{\n", __LINE__, Indent());
        ++depth_;
        stack.push_back(Frame{nullptr, nullptr, false, false, owner == kNoEntry ? target : nullptr,
                              owner, entries.size(), keys.size()});
    };
    auto flat_target = [&](const Frame& frame) -> PObject& {
        return frame.target != nullptr ? *frame.target : entries[frame.owner].value;
    };
    // A flat map's entries leave the scratch as one block, into the object it belongs to.
    auto close_flat = [&](const Frame& frame) {
        size_t count = entries.size() - frame.first;
        FlatMap* flat = nullptr;
        if (count > 0) {
            size_t key_bytes = keys.size() - frame.key_start;
            flat = PObjectAccess::NewFlat(arena(), static_cast<uint32_t>(count),
                                          static_cast<uint32_t>(key_bytes));
            FlatEntry* out = flat->entries();
            // A map of leaves (nulls, integers, strings of this arena) is released later in one
            // step: the map and its strings are counted here.
            bool leaves = true;
            uint32_t blocks = 1;
            for (size_t i = 0; i < count; ++i) {
                PendingEntry& entry = entries[frame.first + i];
                if (entry.value.isString()) {
                    ++blocks;
                    leaves = leaves && PObjectAccess::Text(entry.value).arena == flat->arena;
                } else if (entry.value.isContainer()) {
                    leaves = false;
                }
                PObjectAccess::Move(out[i].value, entry.value);
                out[i].key_offset = static_cast<uint32_t>(entry.key_offset - frame.key_start);
                out[i].key_size = entry.key_size;
            }
            flat->whole_blocks = leaves ? blocks : 0;
            if (key_bytes > 0) {  // with only empty keys the scratch may hold no bytes at all
                std::memcpy(flat->keys(), keys.data() + frame.key_start, key_bytes);
            }
            entries.resize(frame.first);
            keys.resize(frame.key_start);
        }
        PObjectAccess::AssignFlat(flat_target(frame), flat);
    };
    // Keys out of order (or one key twice) are kept as a std::map from here on, which receives
    // a repeated key into its existing value.
    auto unflatten = [&](Frame& frame) {
        PObject& target = flat_target(frame);
        target.clear();
        std::map<std::string, PObject>& tree = target.asMap();
        for (size_t i = frame.first; i < entries.size(); ++i) {
            PendingEntry& entry = entries[i];
            tree.emplace_hint(tree.end(), std::piecewise_construct,
                              std::forward_as_tuple(keys.data() + entry.key_offset, entry.key_size),
                              std::forward_as_tuple(std::move(entry.value)));
        }
        entries.resize(frame.first);
        keys.resize(frame.key_start);
        frame.map = &tree;
    };
    if (array != nullptr || map != nullptr) {
        open(array, map);
    }

    auto next_tag = [&](unsigned char& next) {
        ++received_;
        const char* at = direct_ ? channel.BufferedRun(1) : nullptr;
        if (at == nullptr) {
            return RecvTag(channel, next);
        }
        next = static_cast<unsigned char>(*at);
        channel.Consume(1);
        return 0;
    };
    // A string body buffered whole in the ring: its bytes (up to the first NUL) and the wire
    // bytes to consume, or null.
    auto buffered_text = [&](size_t& size, unsigned int& wire) -> const char* {
        const char* at = direct_ ? channel.BufferedRun(2) : nullptr;
        if (at == nullptr) {
            return nullptr;
        }
        unsigned int length =
            (static_cast<unsigned char>(at[0]) << 8) | static_cast<unsigned char>(at[1]);
        if (channel.BufferedRun(2 + length) == nullptr) {
            return nullptr;
        }
        size = strnlen(at + 2, length);
        wire = 2 + length;
        return at + 2;
    };

    // An array of primitives that lies whole in the ring from `at` (just past its tag) to its end
    // tag before `end`, built at once into the null `target` as one block of the message's arena
    // (released in one step, like a map of leaves): the wire bytes it took, end tag included, or
    // 0 when the bytes are not such an array (then nothing is built).
    auto leaf_array = [&](const char* at, const char* end, PObject& target) -> size_t {
        if (max_recv_depth_ != 0 && stack.size() >= max_recv_depth_) {
            return 0;
        }
        size_t count = 0;
        const char* p = at;
        for (; p < end && static_cast<unsigned char>(*p) != kTagEnd; ++count) {
            const size_t wire = PrimitiveWire(p, end);
            if (wire == 0) {
                return 0;
            }
            p += wire;
        }
        if (p >= end) {
            return 0;
        }
        FlatArray* flat = nullptr;
        if (count > 0) {
            Arena* const message = arena();
            flat = PObjectAccess::NewFlatArrayUnfilled(message, static_cast<uint32_t>(count));
            PObject* items = flat->items();
            uint32_t blocks = 1;  // the array, and each of its strings
            for (const char* item = at; item < p; ++items) {
                const size_t wire = PrimitiveWire(item, end);
                StorePrimitive(item, wire, *new (items) PObject(), message, end);
                blocks += items->isString() ? 1 : 0;
                item += wire;
            }
            flat->whole_blocks = blocks;
        }
        PObjectAccess::SetFlatArray(target, flat);  // an empty one has no payload at all
        return static_cast<size_t>(p + 1 - at);
    };

    // A map that lies whole in the ring from `at` (just past its tag) to its end tag before
    // `end`, in ascending key order, with at most kMostBuilt entries, built at once into its
    // block (no scratch, no key path: nothing can read the path meanwhile): the wire bytes it
    // took, end tag included, or 0 when the bytes are not such a map (then nothing is kept).
    // Its values are primitives, and with `nested` also maps or arrays of primitives (a request
    // as front ends send it). Each entry is built as it is read, in place on the stack, and the
    // entries move into the map's block once its end tag gives their count.
    auto build_map = [&](auto& self, const char* at, const char* end, PObject& target,
                         bool nested) -> size_t {
        // Nested containers count one level more.
        if (max_recv_depth_ != 0 && stack.size() + (nested ? 1 : 0) >= max_recv_depth_) {
            return 0;
        }
        constexpr uint32_t kMostBuilt = 64;  // a larger map takes the general loop
        // The entries built so far; released on every way out unless moved.
        struct Built {
            alignas(FlatEntry) unsigned char bytes[kMostBuilt][sizeof(FlatEntry)];
            const char* keys[kMostBuilt];
            uint32_t count = 0;
            FlatEntry& at(uint32_t i) { return *reinterpret_cast<FlatEntry*>(bytes[i]); }
            ~Built() {
                while (count > 0) {
                    at(--count).~FlatEntry();
                }
            }
        } built;
        const char* p = at;
        Arena* const message =
            p < end && static_cast<unsigned char>(*p) != kTagEnd ? arena() : nullptr;
        size_t key_bytes = 0;
        const char* previous = nullptr;
        size_t previous_size = 0;
        uint32_t blocks = 1;  // the map, and everything in it
        while (p < end && static_cast<unsigned char>(*p) != kTagEnd) {
            if (static_cast<unsigned char>(*p) != kTagString || end - p < 3 ||
                built.count == kMostBuilt) {
                return 0;
            }
            const size_t key_wire = (static_cast<size_t>(static_cast<unsigned char>(p[1])) << 8) |
                                    static_cast<unsigned char>(p[2]);
            if (static_cast<size_t>(end - p) - 3 < key_wire + 1) {
                return 0;
            }
            const char* key = p + 3;
            const size_t key_size = TextLength(key, key_wire, end);
            if (previous != nullptr && CompareKeys(previous, previous_size, key, key_size) >= 0) {
                return 0;
            }
            const char* value = key + key_wire;
            size_t value_wire = PrimitiveWire(value, end);
            FlatEntry& entry = *new (built.bytes[built.count])
                                   FlatEntry{PObject(), 0, static_cast<uint32_t>(key_size)};
            built.keys[built.count++] = key;
            if (value_wire != 0) {
                StorePrimitive(value, value_wire, entry.value, message, end);
                blocks += entry.value.isString() ? 1 : 0;
            } else {
                const unsigned char tag = static_cast<unsigned char>(*value);
                if (!nested || (tag != kTagMap && tag != kTagArray)) {
                    return 0;
                }
                value_wire = tag == kTagMap ? self(self, value + 1, end, entry.value, false)
                                            : leaf_array(value + 1, end, entry.value);
                if (value_wire == 0) {
                    return 0;
                }
                ++value_wire;  // the container's tag
                // Built here, it lives wholly in the message's arena (an empty one takes none).
                if (PObjectAccess::IsFlat(entry.value)) {
                    blocks += PObjectAccess::Flat(entry.value).whole_blocks;
                } else if (PObjectAccess::IsFlatArray(entry.value)) {
                    blocks += PObjectAccess::FlatItems(entry.value).whole_blocks;
                }
            }
            key_bytes += key_size;
            previous = key;
            previous_size = key_size;
            p = value + value_wire;
        }
        if (p >= end) {
            return 0;
        }
        FlatMap* flat = nullptr;
        if (built.count > 0) {
            flat = PObjectAccess::NewFlatUnfilled(message, built.count,
                                                  static_cast<uint32_t>(key_bytes));
            FlatEntry* out = flat->entries();
            char* const key_area = flat->keys();
            uint32_t offset = 0;
            for (uint32_t i = 0; i < built.count; ++i) {
                FlatEntry& entry = built.at(i);
                new (&out[i]) FlatEntry{PObject(), offset, entry.key_size};
                PObjectAccess::Move(out[i].value, entry.value);
                CopyBytes(key_area + offset, built.keys[i], entry.key_size);
                offset += entry.key_size;
            }
            flat->whole_blocks = blocks;
            built.count = 0;  // moved out: nothing left to release
        }
        PObjectAccess::AssignFlat(target, flat);
        return static_cast<size_t>(p + 1 - at);
    };
    // A map of primitives only.
    auto leaf_map = [&](const char* at, const char* end, PObject& target) {
        return build_map(build_map, at, end, target, false);
    };
    // A map of primitives and of maps or arrays of primitives.
    auto whole_map = [&](const char* at, const char* end, PObject& target) {
        return build_map(build_map, at, end, target, true);
    };

    // Entries of a flat map whose key and primitive value are buffered whole (in one piece of
    // the ring) and arrive in ascending key order, read in one pass without the per-value steps:
    // the run's last key goes on the history once, as if each key had been put there and
    // replaced by the next. The run is taken only when no debug line is due (direct_) and no
    // reader holds the key path (a locked span), and stops before anything else, which the
    // general loop below then reads.
    auto flat_run = [&](Frame& top) {
        unsigned int buffered = 0;
        const char* const start = channel.BufferedSpan(buffered);
        const char* const end = start + buffered;
        const char* at = start;
        const char* last_key = nullptr;
        size_t last_size = 0;
        while (end - at >= 5 && static_cast<unsigned char>(at[0]) == kTagString) {
            const size_t key_wire =
                (static_cast<unsigned char>(at[1]) << 8) | static_cast<unsigned char>(at[2]);
            if (static_cast<size_t>(end - at) < 3 + key_wire + 3) {
                break;  // the key and the start of its value are not buffered yet
            }
            const char* value = at + 3 + key_wire;
            // A map or an array of primitives as the value is taken whole too.
            PObject nested;
            size_t value_wire = PrimitiveWire(value, end);
            if (value_wire == 0 && static_cast<unsigned char>(value[0]) == kTagMap) {
                value_wire = leaf_map(value + 1, end, nested);
                value_wire += value_wire != 0 ? 1 : 0;
            } else if (value_wire == 0 && static_cast<unsigned char>(value[0]) == kTagArray) {
                value_wire = leaf_array(value + 1, end, nested);
                value_wire += value_wire != 0 ? 1 : 0;
            }
            const size_t wire = 3 + key_wire + value_wire;
            if (value_wire == 0 || (max_recv_bytes_ != 0 && received_ + wire > max_recv_bytes_)) {
                break;  // not whole, a container, or something the general loop reports
            }
            const char* key = at + 3;
            const size_t key_size = TextLength(key, key_wire, end);
            if ((entries.size() != top.first &&
                 CompareKeys(keys.data() + entries.back().key_offset, entries.back().key_size, key,
                             key_size) >= 0) ||
                keys.size() + key_size > UINT32_MAX || entries.size() - top.first >= UINT32_MAX) {
                break;
            }
            PendingEntry& entry = entries.emplace_back();
            entry.key_offset = keys.size();
            entry.key_size = static_cast<uint32_t>(key_size);
            keys.append(key, key_size);
            if (nested.isContainer()) {
                PObjectAccess::Move(entry.value, nested);
            } else {
                StorePrimitive(value, value_wire, entry.value, arena(), end);
            }
            received_ += wire;
            at += wire;
            last_key = key;
            last_size = key_size;
        }
        if (at == start) {
            return;
        }
        ResetStatus();
        // When the map's end tag follows in the ring, the key would only be taken off again, and
        // when a whole key follows, the general loop reads it at once (no wait) and puts it on
        // the path in this key's place. Nothing can read the path in between.
        const bool end_follows = at < end && static_cast<unsigned char>(*at) == kTagEnd;
        const bool key_follows = end - at >= 3 && static_cast<unsigned char>(*at) == kTagString &&
                                 static_cast<size_t>(end - at) - 3 >=
                                     static_cast<size_t>((static_cast<unsigned char>(at[1]) << 8) |
                                                         static_cast<unsigned char>(at[2]));
        if (!end_follows && !key_follows) {
            if (top.key_done) {
                ReplaceKey(last_key, last_size);
            } else {
                PushKey(last_key, last_size);
            }
            top.key_done = true;
        }
        channel.Consume(static_cast<unsigned int>(at - start));
    };

    // Array elements that are primitives, or maps of primitive entries taken from their tag to
    // their end tag, in place of the general loop's steps while they are buffered whole. A map
    // that is not (a container inside, bytes still to come) stays open for the general loop, as
    // does anything else. True when it took at least one element or map tag.
    auto elements_run = [&](size_t array_frame) {
        for (bool progress = false;; progress = true) {
            unsigned int run = 0;
            const char* at = channel.BufferedSpan(run);
            const size_t primitive = at == nullptr ? 0 : PrimitiveWire(at, at + run);
            if (primitive != 0 &&
                (max_recv_bytes_ == 0 || received_ + primitive <= max_recv_bytes_)) {
                ResetStatus();
                std::vector<PObject>& items = *stack[array_frame].array;
                if (items.size() == items.capacity()) {
                    // Room for every primitive element buffered from here at once.
                    size_t count = 0;
                    for (const char* next = at; next < at + run; ++count) {
                        const size_t hop = PrimitiveWire(next, at + run);
                        if (hop == 0) {
                            break;
                        }
                        next += hop;
                    }
                    items.reserve(items.size() + count);
                }
                StorePrimitive(at, primitive, items.emplace_back(), arena(), at + run);
                channel.Consume(static_cast<unsigned int>(primitive));
                received_ += primitive;
                continue;
            }
            if (at == nullptr || static_cast<unsigned char>(*at) != kTagMap ||
                (max_recv_depth_ != 0 && stack.size() >= max_recv_depth_) ||
                (max_recv_bytes_ != 0 && received_ + 1 > max_recv_bytes_)) {
                return progress;
            }
            PObject whole;
            const size_t wire = leaf_map(at + 1, at + run, whole);
            if (wire != 0 && (max_recv_bytes_ == 0 || received_ + 1 + wire <= max_recv_bytes_)) {
                ResetStatus();
                stack[array_frame].array->push_back(std::move(whole));
                channel.Consume(static_cast<unsigned int>(1 + wire));
                received_ += 1 + wire;
                continue;
            }
            channel.Consume(1);
            ++received_;
            Frame& items = stack[array_frame];
            items.array->emplace_back();
            items.pending = true;
            // On the stack while its entries are read, so that the depth of what they hold is
            // counted from it.
            stack.push_back(Frame{nullptr, nullptr, false, false, &items.array->back(), kNoEntry,
                                  entries.size(), keys.size()});
            ++depth_;
            flat_run(stack.back());
            at = channel.BufferedRun(1);
            if (at == nullptr || static_cast<unsigned char>(*at) != kTagEnd) {
                return true;
            }
            channel.Consume(1);
            ++received_;
            if (stack.back().key_done) {
                PopKey();
            }
            --depth_;
            close_flat(stack.back());
            stack.pop_back();
            stack[array_frame].pending = false;
        }
    };

    // Nesting beyond the limit is refused before the container is entered.
    auto too_deep = [&] {
        if (max_recv_depth_ == 0 || stack.size() < max_recv_depth_) {
            return false;
        }
        Logger::LogMsg(Logger::Error,
                       "[ERROR] s2s_stream.cpp(%d): PStream: message nested deeper than %u "
                       "levels refused\n",
                       __LINE__, max_recv_depth_);
        return true;
    };

    int ret = 0;
    std::string text;
    size_t slot_owner = kNoEntry;  // the scratch entry whose value `slot` is, if it is one
    received_ = 0;
    for (;;) {
        bool completed = false;  // a whole value (primitive or closed container) was read
        if (max_recv_bytes_ != 0 && received_ > max_recv_bytes_) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] s2s_stream.cpp(%d): PStream: message longer than %zu bytes "
                           "refused\n",
                           __LINE__, max_recv_bytes_);
            ret = kStatusProtocolError;
            break;
        }
        if (slot != nullptr) {
            PObject& target = *slot;
            const size_t target_owner = slot_owner;
            slot = nullptr;
            slot_owner = kNoEntry;
            if (!have_tag) {
                ret = next_tag(tag);
                if (ret < 0) {
                    break;
                }
            }
            have_tag = false;
            switch (tag) {
                case kTagString: {
                    size_t size = 0;
                    unsigned int wire = 0;
                    const char* at = buffered_text(size, wire);
                    if (at != nullptr) {
                        // Straight from the ring into the message's arena (no debug line is due
                        // on this path).
                        ResetStatus();
                        received_ += wire;
                        PObjectAccess::AssignText(target, arena(), at, size);
                        channel.Consume(wire);
                        break;
                    }
                    ret = RecvText(channel, text, false);
                    if (ret >= 0) {
                        PObjectAccess::AssignText(target, arena(), text.data(), text.size());
                    } else if (!target.isString() || target.isNull()) {
                        target = std::string();  // what reading into a fresh string leaves
                    }
                    break;
                }
                case kTagInteger: {
                    unsigned long long value = 0;
                    ret = Recv(channel, value);
                    if (ret >= 0) {
                        target = value;
                    } else if (!target.isInteger() || target.isNull()) {
                        target = 0ULL;
                    }
                    break;
                }
                case kTagArray:
                    if (too_deep()) {
                        ret = kStatusProtocolError;
                        break;
                    }
                    open(&target.asArray(), nullptr);  // appends to an array already there
                    continue;
                case kTagMap:
                    if (too_deep()) {
                        ret = kStatusProtocolError;
                        break;
                    }
                    if (target.isMap() && !target.isEmpty()) {
                        open(nullptr, &target.asMap());  // merges into a map already there
                        continue;
                    }
                    if (direct_ && !span_locked_) {
                        // A whole map of primitives and containers of primitives is built at
                        // once.
                        unsigned int run = 0;
                        const char* at = channel.BufferedSpan(run);
                        PObject whole;
                        const size_t wire = at == nullptr ? 0 : whole_map(at, at + run, whole);
                        if (wire != 0 &&
                            (max_recv_bytes_ == 0 || received_ + wire <= max_recv_bytes_)) {
                            ResetStatus();
                            target.swap(whole);
                            channel.Consume(static_cast<unsigned int>(wire));
                            received_ += wire;
                            break;
                        }
                    }
                    open_flat(&target, target_owner);
                    continue;
                case kTagNull: {
                    unsigned char length = 0;
                    ++received_;
                    ret = ReadByte(channel, length);
                    if (ret < 0) {
                        ret = ChannelFailure(ret);
                    } else if (length != 0) {
                        Logger::LogMsg(
                            Logger::Error,
                            "[ERROR] s2s_stream.cpp(%d): expect length 0, but we've got %u\n",
                            __LINE__, length);
                        ret = kStatusProtocolError;
                    } else {
                        target.clear();
                    }
                    break;
                }
                default:  // the end tag where a value belongs, or a tag this format lacks
                    ret = Skip(channel, tag);
                    break;
            }
            if (ret < 0) {
                break;
            }
            completed = true;
        } else {
            if (direct_ && !span_locked_) {
                if (stack.back().flat()) {
                    flat_run(stack.back());
                } else if (stack.back().array != nullptr && elements_run(stack.size() - 1)) {
                    continue;  // a map may have been left open: the loop looks again
                }
            }
            Frame& top = stack.back();
            ret = next_tag(tag);
            if (ret < 0) {
                break;
            }
            if (tag == kTagEnd) {
                if (top.key_done) {
                    PopKey();
                    top.key_done = false;
                }
                bool is_array = top.array != nullptr;
                --depth_;
                S2S_LOG_DEBUG("[DEBUG] s2s_stream.cpp(%d): %s%s\n", __LINE__, Indent(),
                              is_array ? "]" : "}");
                if (top.flat()) {
                    close_flat(top);
                }
                stack.pop_back();
                completed = true;
            } else if (top.array != nullptr) {
                top.array->emplace_back();
                top.pending = true;
                slot = &top.array->back();
                have_tag = true;
            } else if (tag != kTagString) {
                Logger::LogMsg(Logger::Error,
                               "[ERROR] s2s_stream.cpp(%d): PStream: expect string, but get tag "
                               "%u\n",
                               __LINE__, tag);
                ret = kStatusProtocolError;
                break;
            } else {
                // A key buffered whole is read in place in the ring (no debug line is due on
                // that path); the ring keeps it until it is consumed below.
                size_t key_size = 0;
                unsigned int wire = 0;
                const char* key = buffered_text(key_size, wire);
                if (key != nullptr) {
                    ResetStatus();
                    received_ += wire;
                } else {
                    ret = RecvText(channel, text, true);
                    if (ret < 0) {
                        break;
                    }
                    key = text.data();
                    key_size = text.size();
                }
                if (top.flat()) {
                    // A conforming writer sends keys in ascending order, each once.
                    bool in_order = entries.size() == top.first ||
                                    CompareKeys(keys.data() + entries.back().key_offset,
                                                entries.back().key_size, key, key_size) < 0;
                    if (!in_order || keys.size() + key_size > UINT32_MAX ||
                        entries.size() - top.first >= UINT32_MAX) {
                        unflatten(top);
                    }
                }
                if (top.flat()) {
                    PendingEntry& entry = entries.emplace_back();
                    entry.key_offset = keys.size();
                    entry.key_size = static_cast<uint32_t>(key_size);
                    keys.append(key, key_size);
                    slot = &entries.back().value;
                    slot_owner = entries.size() - 1;
                } else {
                    // Keys arrive in order from a conforming writer: the end is the likely place.
                    auto entry = top.map->emplace_hint(top.map->end(), std::piecewise_construct,
                                                       std::forward_as_tuple(key, key_size),
                                                       std::forward_as_tuple());
                    slot = &entry->second;
                }
                if (top.key_done) {
                    ReplaceKey(key, key_size);
                    top.key_done = false;
                } else {
                    PushKey(key, key_size);
                }
                if (wire != 0) {
                    channel.Consume(wire);
                }
                top.pending = true;
            }
        }
        if (completed) {
            if (stack.empty()) {
                return kStatusSuccessful;
            }
            Frame& top = stack.back();
            if (top.pending) {
                top.key_done = top.array == nullptr;  // the pop is owed (see Frame)
                top.pending = false;
            }
        }
    }
    // An array element that failed is not kept; a map entry keeps what arrived of its value, and
    // the key path of the failure stays on the history. Maps still being built are put in place
    // innermost first, each into its entry of the next.
    for (auto it = stack.rbegin(); it != stack.rend(); ++it) {
        if (it->flat()) {
            close_flat(*it);
        }
        if (it->array != nullptr && it->pending) {
            it->array->pop_back();
        }
        if (it->key_done) {  // a finished entry's key is not part of the failing path
            PopKey();
        }
    }
    return ret;
}

}  // namespace S2S
