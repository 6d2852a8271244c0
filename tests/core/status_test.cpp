#include <gtest/gtest.h>

#include <climits>
#include <string>

#include "s2s_status.h"

TEST(StatusMessage, FixedTexts) {
    EXPECT_STREQ(S2S::StatusMessage(0), "Successful");
    EXPECT_STREQ(S2S::StatusMessage(S2S::kStatusProtocolError), "Protocal error");
    EXPECT_STREQ(S2S::StatusMessage(-17), "Sync Folder is miss");
    EXPECT_STREQ(S2S::StatusMessage(-19), "no permission ");
    EXPECT_STREQ(S2S::StatusMessage(-21), "connection about by setting flag");
    EXPECT_STREQ(S2S::StatusMessage(-25), "permission is read-only");
    EXPECT_STREQ(S2S::StatusMessage(3), "System error");  // positives by absolute value
}

TEST(StatusMessage, OutOfRange) {
    EXPECT_STREQ(S2S::StatusMessage(-26), "Unknown error");
    EXPECT_STREQ(S2S::StatusMessage(26), "Unknown error");
    EXPECT_STREQ(S2S::StatusMessage(INT_MIN), "Unknown error");
}

TEST(StatusMessage, CodesKeepTheirNumbers) {
    EXPECT_EQ(S2S::kStatusInterrupted, -1);
    EXPECT_EQ(S2S::kStatusConnectionTimeout, -9);
    EXPECT_EQ(S2S::kStatusAbortedByFlag, -21);
    EXPECT_EQ(S2S::kStatusCertVerifyFail, -24);
    EXPECT_EQ(S2S::kStatusReadOnly, -25);
}
