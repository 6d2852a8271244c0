// Status texts in one table as peers and log readers see them (odd spellings kept; positive codes
// by absolute value; a fallback past the range), and the numbers of named codes, which travel.
#include <gtest/gtest.h>

#include <climits>
#include <vector>

#include "s2s_status.h"

TEST(StatusMessage, OneTableOfCodesAndTheirTexts) {
    const std::pair<int, const char*> table[] = {{0, "Successful"},
                                                 {-1, "Interrupted"},
                                                 {-5, "Protocal error"},
                                                 {-9, "Connection timeout"},
                                                 {-17, "Sync Folder is miss"},
                                                 {-19, "no permission "},
                                                 {-21, "connection about by setting flag"},
                                                 {-24, "ssl certificate verify fail"},
                                                 {-25, "permission is read-only"},
                                                 {3, "System error"},
                                                 {-26, "Unknown error"},
                                                 {26, "Unknown error"},
                                                 {INT_MIN, "Unknown error"}};
    for (const auto& [code, text] : table) {
        EXPECT_STREQ(text, S2S::StatusMessage(code)) << code;
    }
    EXPECT_EQ(std::vector<int>({-1, -5, -9, -21, -24, -25}),
              std::vector<int>({S2S::kStatusInterrupted, S2S::kStatusProtocolError,
                                S2S::kStatusConnectionTimeout, S2S::kStatusAbortedByFlag,
                                S2S::kStatusCertVerifyFail, S2S::kStatusReadOnly}));
}
