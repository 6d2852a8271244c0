// Short byte copies on the data path (tags, lengths, keys, small strings) without a library call.
#ifndef S2S_CORE_COPY_BYTES_H
#define S2S_CORE_COPY_BYTES_H

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace S2S {

// Copies `size` bytes, sizeof(Word) <= size <= 2 * sizeof(Word), as two overlapping words.
template <typename Word>
inline void CopyOverlapping(char* to, const char* from, size_t size) {
    Word head;
    Word tail;
    std::memcpy(&head, from, sizeof(Word));
    std::memcpy(&tail, from + size - sizeof(Word), sizeof(Word));
    std::memcpy(to, &head, sizeof(Word));
    std::memcpy(to + size - sizeof(Word), &tail, sizeof(Word));
}

// Copies `size` bytes. Most copies are short: up to 16 bytes move as two overlapping words (or
// byte by byte below four) rather than through a call.
inline void CopyBytes(char* to, const char* from, size_t size) {
    if (size > 16) {
        std::memcpy(to, from, size);
    } else if (size >= 8) {
        CopyOverlapping<uint64_t>(to, from, size);
    } else if (size >= 4) {
        CopyOverlapping<uint32_t>(to, from, size);
    } else {
        for (size_t i = 0; i < size; ++i) {
            to[i] = from[i];
        }
    }
}

}  // namespace S2S

#endif  // S2S_CORE_COPY_BYTES_H
