// The control socket's request scanner on the bytes a client may send: a whole request is found
// exactly at its end, every part of one waits for more, nesting is bounded before any decoding,
// and mangled bytes (run under the sanitizers) never read past what arrived.
#include "service/message.h"

#include <gtest/gtest.h>

#include <random>

namespace {

using s2sd::Scan;

std::string Str(const std::string& text) {
    return std::string("\x10", 1) + static_cast<char>(text.size() >> 8) +
           static_cast<char>(text.size() & 0xFF) + text;
}

// {"command": "list", "task_id": 7, "x": [null, "ab"]}, as the wire format writes it.
const std::string kRequest = "\x42" + Str("command") + Str("list") + Str("task_id") +
                             std::string("\x01\x01\x07", 3) + Str("x") + "\x41" +
                             std::string("\x00\x00", 2) + Str("ab") + "\x40\x40";

TEST(RequestScanner, AWholeRequestIsFoundAtItsEndAndEveryPartWaitsForMore) {
    size_t length = 0;
    for (size_t n = 0; n < kRequest.size(); ++n) {
        EXPECT_EQ(s2sd::ScanMessage(kRequest.substr(0, n), 16, length), Scan::kIncomplete) << n;
    }
    ASSERT_EQ(s2sd::ScanMessage(kRequest + "\x42trailing", 16, length), Scan::kComplete);
    EXPECT_EQ(length, kRequest.size());
    S2S::PObject request;
    ASSERT_EQ(s2sd::DecodeMessage(kRequest, length, request), 0);
    EXPECT_EQ(request["command"].asString(), "list");
    EXPECT_EQ(request["x"].asArray().size(), 2u);

    EXPECT_EQ(s2sd::ScanMessage(kRequest, 1, length), Scan::kTooDeep);
    EXPECT_EQ(s2sd::ScanMessage(std::string(100, '\x41'), 16, length), Scan::kTooDeep);
    for (const std::string& bad :
         {std::string("\x40", 1), std::string("\x42\x01\x01\x07\x40"), std::string("\x01\x09", 2),
          "\x42" + Str("k") + "\x40", std::string("\x00\x01", 2), std::string("\x7f", 1)}) {
        EXPECT_EQ(s2sd::ScanMessage(bad, 16, length), Scan::kMalformed);
    }
}

TEST(RequestScanner, MangledRequestsAreJudgedWithinTheBytesReceived) {
    std::mt19937 random(20240521);
    for (int round = 0; round < 20000; ++round) {
        std::string bytes = kRequest;
        for (int edits = 1 + static_cast<int>(random() % 4); edits > 0; --edits) {
            // Overwrite, drop or insert bytes at a random place.
            const size_t at = random() % bytes.size(), what = random() % 3;
            const std::string junk(1, static_cast<char>(random()));
            bytes.replace(at,
                          what == 2   ? 0
                          : what == 1 ? 1 + random() % 3
                                      : 1,
                          what == 1 ? "" : junk);
            bytes = bytes.empty() ? "\x42" : bytes;
        }
        // Exactly the bytes received: anything read past them is caught by the sanitizers.
        const std::string received(bytes);
        size_t length = 0;
        if (s2sd::ScanMessage(received, 16, length) == Scan::kComplete) {
            ASSERT_LE(length, received.size());
            S2S::PObject value;
            s2sd::DecodeMessage(received, length, value);
        }
    }
}

}  // namespace
