// PStream: writes one PObject to a Channel in the library's compact tagged form and reads one
// back (docs/wire-format.md describes the bytes). Each tag is one byte: 0x00 null (followed by a
// length byte 0), 0x01 integer (length byte n in 1..8, then n big-endian bytes), 0x10 string
// (16-bit big-endian length, then the bytes), 0x41 array and 0x42 map (contents, then the end tag
// 0x40). There is no count, no overall length and no nesting limit in the format itself.
//
// The reader takes bytes from other processes: whatever arrives, it ends with a status. Nesting
// is followed on the heap, not on the call stack. Because a peer could otherwise make a receiver
// build a tree of any size (memory grows many times faster than the bytes that describe it), a
// receive refuses a message deeper than a nesting limit or longer than a byte limit, with
// kStatusProtocolError (-5) and an ERROR line naming the limit. The limits are on by default for
// every receive (kDefaultMaxRecvDepth, kDefaultMaxRecvBytes); SetRecvLimits changes them, 0
// lifting one.
//
// Besides the codec a stream keeps diagnostics: the key path it is inside (logged on a failure),
// the nesting depth (indentation of debug lines) and two status counters. Another thread may read
// them (GetStatus) while one thread transfers a message. At debug level every value written or
// read is logged, except a string under a key that names a password (a key containing "pswd" or
// "passw" in any letter case, such as a task map's "pswd"): that one is logged as "********".
#ifndef S2S_STREAM_H
#define S2S_STREAM_H

#include <pthread.h>

#include <atomic>
#include <cstddef>
#include <map>
#include <string>
#include <vector>

#include "s2s_channel.h"
#include "s2s_export.h"
#include "s2s_pobject.h"

namespace S2S {

class S2S_EXPORT PStream {
  public:
    enum : unsigned char {
        kTagNull = 0x00,
        kTagInteger = 0x01,
        kTagString = 0x10,
        kTagEnd = 0x40,    // '@'
        kTagArray = 0x41,  // 'A'
        kTagMap = 0x42,    // 'B'
    };

    // Limits a receive starts with: enough for every message of the service (a task list of tens
    // of thousands of tasks), far below what would exhaust a machine's memory.
    static constexpr unsigned int kDefaultMaxRecvDepth = 512;
    static constexpr size_t kDefaultMaxRecvBytes = 16u << 20;

    PStream();
    ~PStream();
    PStream(const PStream&) = delete;
    PStream& operator=(const PStream&) = delete;

    // One whole message: the object, then a flush. The state is cleared afterwards, and after a
    // failure the key path is logged first. Results: 0, -1 (unknown type code), -2 (channel).
    int Send(Channel& channel, const PObject& object);
    // One whole message. Receiving into a non-empty container adds to it (arrays append, maps
    // merge key by key); a failure keeps what was received so far. Results: 0, -2, -5.
    int Recv(Channel& channel, PObject& object);

    int SendObject(Channel& channel, const PObject& object);
    // Reads a tag, then the value that follows it.
    int RecvObject(Channel& channel, PObject& object);
    int RecvTag(Channel& channel, unsigned char& tag);
    // Reads the value that follows `tag` into `object`.
    int RecvDispatch(Channel& channel, unsigned char tag, PObject& object);

    // The sends write their own tag; the receives expect it consumed already.
    int Send(Channel& channel, unsigned long long value);
    int Recv(Channel& channel, unsigned long long& value);
    // Only the low 16 bits of the length go on the wire, then every byte: callers keep strings
    // shorter than 65536 bytes. The reader keeps a string only up to its first NUL byte.
    int Send(Channel& channel, const std::string& value);
    int Recv(Channel& channel, std::string& value);
    int SendNull(Channel& channel);
    int Send(Channel& channel, const std::vector<PObject>& array);
    int Recv(Channel& channel, std::vector<PObject>& array);
    // A key's one leading underscore is dropped on the wire (and not restored by the reader).
    int Send(Channel& channel, const std::map<std::string, PObject>& map);
    int Recv(Channel& channel, std::map<std::string, PObject>& map);
    // Unknown tags cannot be skipped: the format carries no length for them. Always -5.
    int Skip(Channel& channel, unsigned char tag);

    // Wire tag and PObject type code of a storage type (unsigned long long, std::string,
    // PObject::Array, PObject::Map).
    template <typename T>
    static unsigned char GetTag();
    template <typename T>
    static int GetType() {
        return PObject::type_trait<T>();
    }
    static void GetVersion(unsigned& major, unsigned& minor, unsigned& patch);

    void UpdateStatus(unsigned long long a, unsigned long long b);
    void GetStatus(std::string& path, unsigned long long& a, unsigned long long& b);
    // The key path joined with "."; takes no lock (callers hold it or own the stream).
    std::string GetHistory();
    void DumpHistory();
    void ClearHistory();
    // Stored only.
    void SetDefaultRecvLocation(const std::string& path);
    // Nesting levels and wire bytes one receive accepts (0: no limit).
    void SetRecvLimits(size_t max_bytes, unsigned int max_depth);

  private:
    struct Frame;

    int Decode(Channel& channel, PObject* slot, bool have_tag, unsigned char tag,
               std::vector<PObject>* array, std::map<std::string, PObject>* map);
    int Encode(Channel& channel, const PObject* object, const std::vector<PObject>* array,
               const std::map<std::string, PObject>* map);
    // Channel access for the codec: straight to the rings for a plain Channel when debug lines are
    // off (nothing could observe a difference), through the virtual operations otherwise.
    int ReadByte(Channel& channel, unsigned char& byte);
    int ReadInt16(Channel& channel, unsigned short& value);
    int ReadBytes(Channel& channel, char* dst, unsigned int len);
    int WriteByte(Channel& channel, unsigned char byte);
    int WriteBytes(Channel& channel, const char* src, size_t len);
    int WriteString(Channel& channel, const char* data, size_t len);
    void SetDirect(const Channel& channel);
    void OpenSpan(const Channel& channel);
    void CloseSpan();
    void LockSpan();
    struct Parked;
    int SendKey(Channel& channel, const char* key, size_t length);
    // A string body into `text` (scratch: its content is undefined after a failure). A map key
    // (`is_key`) is logged as it is; a value may be masked (LoggedValue).
    int RecvText(Channel& channel, std::string& text, bool is_key);
    int ChannelFailure(int status);
    // The history is edited by the transferring thread and read, rarely, by others (GetStatus,
    // DumpHistory). An edit takes the mutex only while someone reads: the editor announces itself
    // in editing_ and then looks at watchers_, a reader announces itself in watchers_ and then
    // waits for editing_ to fall before taking the mutex. A full barrier between each one's
    // announcement and its look makes at least one of the two see the other; the reader pays for
    // both sides with a process-wide barrier where the kernel offers one.
    // Inside Encode and Decode the announcement covers a whole span of edits instead of one: the
    // span ends (the path is then whole and readable) before any channel call that may wait, and
    // turns into locked edits as soon as a reader is seen, so a reader never waits for more than
    // the decoding of what is already buffered.
    bool BeginEdit();
    void EndEdit(bool locked);
    void Watch();
    void Unwatch();
    void ResetStatus();
    void PushKey(const char* key, size_t length);
    // Pop and push in one locked step: the entry's key gives way to the next key of its map.
    void ReplaceKey(const char* key, size_t length);
    void PopKey();
    const char* Indent() const;
    // What a debug line shows for a string value: the value itself, or a mask when the innermost
    // key of the history names a password. Called by the transferring thread, which alone changes
    // the history, so it needs no lock.
    const char* LoggedValue(const char* value) const;

    // The stack of keys is kept already joined ("k1.k2.k3"); marks_ holds where each key starts,
    // so a pop or a replacement is one string operation and none allocates once the path has
    // grown.
    std::string history_;
    std::vector<size_t> marks_;
    std::atomic<unsigned long long> status_b_{0};
    std::atomic<unsigned long long> status_a_{0};
    pthread_mutex_t mutex_;
    int depth_ = 0;
    std::string recv_location_;
    std::atomic<int> watchers_{0};
    std::atomic<bool> editing_{false};
    size_t max_recv_bytes_ = kDefaultMaxRecvBytes;
    unsigned int max_recv_depth_ = kDefaultMaxRecvDepth;
    size_t received_ = 0;  // wire bytes of the receive in progress
    // Set for each message: the codec may go straight to the channel's rings (see SetDirect).
    bool direct_ = false;
    // A message in transfer edits the key path in one span (see OpenSpan); `span_locked_` once a
    // reader has appeared, after which each edit takes the mutex.
    bool span_ = false;
    bool span_locked_ = false;
};

template <>
inline unsigned char PStream::GetTag<unsigned long long>() {
    return kTagInteger;
}
template <>
inline unsigned char PStream::GetTag<std::string>() {
    return kTagString;
}
template <>
inline unsigned char PStream::GetTag<PObject::Array>() {
    return kTagArray;
}
template <>
inline unsigned char PStream::GetTag<PObject::Map>() {
    return kTagMap;
}

}  // namespace S2S

#endif  // S2S_STREAM_H
