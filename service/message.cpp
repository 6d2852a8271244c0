// Framing and decoding of control requests (docs/wire-format.md gives the tags).
#include "service/message.h"

#include <cstring>
#include <vector>

#include "s2s_channel.h"
#include "s2s_status.h"
#include "s2s_stream.h"

namespace s2sd {

namespace {

using S2S::PStream;  // its tags are the wire's

// A channel that reads from bytes already received. PStream reads a channel of another type
// through its virtual operations, so these are all it needs.
class MemoryChannel : public S2S::Channel {
  public:
    MemoryChannel(const std::string& bytes, size_t length)
        : Channel(64), data_(bytes.data()), left_(length) {}

    int Read(char* dst, unsigned int len) override {
        if (len > left_) {
            return S2S::kStatusIOError;
        }
        std::memcpy(dst, data_, len);
        data_ += len;
        left_ -= len;
        return S2S::kStatusSuccessful;
    }
    int Read(char* dst, unsigned int len, unsigned int& count) override {
        count = 0;
        const int ret = Read(dst, len);
        if (ret == S2S::kStatusSuccessful) {
            count = len;
        }
        return ret;
    }
    int ReadByte(unsigned char* value) override { return Read(reinterpret_cast<char*>(value), 1); }
    int ReadInt16(unsigned short* value) override {
        unsigned char b[2];
        const int ret = Read(reinterpret_cast<char*>(b), 2);
        if (ret == S2S::kStatusSuccessful) {
            *value = static_cast<unsigned short>((b[0] << 8) | b[1]);
        }
        return ret;
    }
    int ReadInt32(unsigned int* value) override {
        unsigned char b[4];
        const int ret = Read(reinterpret_cast<char*>(b), 4);
        if (ret == S2S::kStatusSuccessful) {
            *value = (static_cast<unsigned int>(b[0]) << 24) | (b[1] << 16) | (b[2] << 8) | b[3];
        }
        return ret;
    }
    int ReadInt64(unsigned long long* value) override {
        unsigned int high = 0;
        unsigned int low = 0;
        int ret = ReadInt32(&high);
        if (ret == S2S::kStatusSuccessful) {
            ret = ReadInt32(&low);
        }
        if (ret == S2S::kStatusSuccessful) {
            *value = (static_cast<unsigned long long>(high) << 32) | low;
        }
        return ret;
    }

  private:
    const char* data_;
    size_t left_;
};

}  // namespace

Scan ScanMessage(const std::string& bytes, size_t max_depth, size_t& length) {
    struct Frame {
        bool map;
        bool key_next;  // a map's next item is a key (or its end)
    };
    std::vector<Frame> open;
    size_t pos = 0;
    const size_t size = bytes.size();
    for (;;) {
        if (pos >= size) {
            return Scan::kIncomplete;
        }
        const unsigned char tag = static_cast<unsigned char>(bytes[pos++]);
        const bool key = !open.empty() && open.back().map && open.back().key_next;
        if (tag == PStream::kTagEnd) {
            // Closes an array, or a map between entries; anywhere else a value was missing.
            if (open.empty() || (open.back().map && !key)) {
                return Scan::kMalformed;
            }
            open.pop_back();
        } else if (key && tag != PStream::kTagString) {
            return Scan::kMalformed;
        } else if (tag == PStream::kTagArray || tag == PStream::kTagMap) {
            if (open.size() >= max_depth) {
                return Scan::kTooDeep;
            }
            open.push_back(Frame{tag == PStream::kTagMap, true});
            continue;
        } else if (tag == PStream::kTagNull) {
            if (pos >= size) {
                return Scan::kIncomplete;
            }
            if (bytes[pos++] != 0) {
                return Scan::kMalformed;
            }
        } else if (tag == PStream::kTagInteger) {
            if (pos >= size) {
                return Scan::kIncomplete;
            }
            const size_t n = static_cast<unsigned char>(bytes[pos++]);
            if (n > 8) {
                return Scan::kMalformed;
            }
            pos += n;
        } else if (tag == PStream::kTagString) {
            if (pos + 2 > size) {
                return Scan::kIncomplete;
            }
            const size_t n = (static_cast<size_t>(static_cast<unsigned char>(bytes[pos])) << 8) |
                             static_cast<unsigned char>(bytes[pos + 1]);
            pos += 2 + n;
        } else {
            return Scan::kMalformed;
        }
        if (pos > size) {
            return Scan::kIncomplete;
        }
        if (open.empty()) {
            length = pos;
            return Scan::kComplete;
        }
        // A key is followed by its value; a finished value in a map by the next key.
        if (open.back().map) {
            open.back().key_next = !(key && tag == PStream::kTagString);
        }
    }
}

int DecodeMessage(const std::string& bytes, size_t length, S2S::PObject& value) {
    MemoryChannel channel(bytes, length);
    S2S::PStream stream;
    return stream.Recv(channel, value) == S2S::kStatusSuccessful ? 0 : -1;
}

}  // namespace s2sd
