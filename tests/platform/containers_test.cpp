// String tables, lists, platform strings, the last error, and the resolution of fixed paths.
#include <gtest/gtest.h>

#include <string>
#include <thread>

#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

using s2s_test::ScopedEnv;

TEST(SzHash, SetGetReplaceRemoveAndOrder) {
    VLIBSzHash* hash = VLIBCSzHashAlloc(2);
    ASSERT_NE(hash, nullptr);
    EXPECT_EQ(VLIBCSzHashGetValue(hash, "a"), nullptr);
    for (int i = 0; i < 100; ++i) {  // grows past the size it was allocated with
        std::string key = "k" + std::to_string(i);
        ASSERT_EQ(VLIBCSzHashSetValue(&hash, key.c_str(), key.c_str()), 0);
    }
    EXPECT_EQ(VLIBCSzHashCount(hash), 100);
    ASSERT_EQ(VLIBCSzHashSetValue(&hash, "k5", "five"), 0);
    EXPECT_STREQ(VLIBCSzHashGetValue(hash, "k5"), "five");
    EXPECT_EQ(VLIBCSzHashCount(hash), 100);
    EXPECT_STREQ(VLIBCSzHashKeyAt(hash, 5), "k5");  // replacing keeps the position

    EXPECT_EQ(VLIBCSzHashRemove(hash, "k0"), 0);
    EXPECT_LT(VLIBCSzHashRemove(hash, "k0"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
    EXPECT_STREQ(VLIBCSzHashKeyAt(hash, 0), "k1");
    EXPECT_STREQ(VLIBCSzHashGetValue(hash, "k99"), "k99");  // index still right after removal
    EXPECT_STREQ(VLIBCSzHashValueAt(hash, 4), "five");
    EXPECT_EQ(VLIBCSzHashKeyAt(hash, 99), nullptr);
    EXPECT_EQ(VLIBCSzHashKeyAt(hash, -1), nullptr);

    VLIBCHashRemoveAll(hash);
    EXPECT_EQ(VLIBCSzHashCount(hash), 0);
    EXPECT_EQ(VLIBCSzHashGetValue(hash, "k5"), nullptr);
    VLIBCSzHashFree(hash);
}

TEST(SzHash, BadArguments) {
    VLIBSzHash* hash = VLIBCSzHashAlloc(0);
    EXPECT_LT(VLIBCSzHashSetValue(&hash, "", "v"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
    EXPECT_LT(VLIBCSzHashSetValue(&hash, nullptr, "v"), 0);
    EXPECT_LT(VLIBCSzHashSetValue(&hash, "k", nullptr), 0);
    EXPECT_LT(VLIBCSzHashSetValue(nullptr, "k", "v"), 0);
    VLIBSzHash* none = nullptr;
    EXPECT_LT(VLIBCSzHashSetValue(&none, "k", "v"), 0);
    EXPECT_EQ(VLIBCSzHashGetValue(nullptr, "k"), nullptr);
    EXPECT_EQ(VLIBCSzHashGetValue(hash, nullptr), nullptr);
    EXPECT_EQ(VLIBCSzHashAlloc(-1), nullptr);
    VLIBCSzHashFree(hash);
    VLIBCSzHashFree(nullptr);
    VLIBCHashRemoveAll(nullptr);
}

TEST(SzList, PushGetCountClear) {
    VLIBSzList* list = VLIBCSzListAlloc(1);
    ASSERT_NE(list, nullptr);
    for (const char* s : {"a", "", "c"}) {
        EXPECT_EQ(VLIBCSzListPush(&list, s), 0);
    }
    EXPECT_EQ(VLIBCSzListCount(list), 3);
    EXPECT_STREQ(VLIBCSzListGet(list, 1), "");
    EXPECT_STREQ(VLIBCSzListGet(list, 2), "c");
    EXPECT_EQ(VLIBCSzListGet(list, 3), nullptr);
    EXPECT_LT(VLIBCSzListPush(&list, nullptr), 0);
    VLIBCSzListRemoveAll(list);
    EXPECT_EQ(VLIBCSzListCount(list), 0);
    EXPECT_EQ(VLIBCSzListCount(nullptr), 0);
    VLIBCSzListFree(list);
    VLIBCSzListFree(nullptr);
}

TEST(PlatformString, FormatsAndDuplicates) {
    char* s = VLIBCStrGet("SHARE_%s", "docs");
    ASSERT_NE(s, nullptr);
    EXPECT_STREQ(s, "SHARE_docs");
    VLIBCStrPut(s);
    std::string big(100000, 'z');
    s = VLIBCStrGet("%s", big.c_str());
    EXPECT_EQ(std::string(s), big);
    VLIBCStrPut(s);
    VLIBCStrPut(nullptr);
}

TEST(PlatformError, IsPerThreadAndHasTexts) {
    VLIBCErrSet(0xEB00);
    int other = -1;
    std::thread([&] { other = VLIBCErrGet(); }).join();
    EXPECT_EQ(other, 0);
    EXPECT_EQ(VLIBCErrGet(), 0xEB00);
    EXPECT_STREQ(VLIBCErrStr(0x2200), "No such section, key or share");
    EXPECT_STREQ(VLIBCErrStr(0x1234), "Unknown error");
}

TEST(S2SPath, ResolvesFixedPathsUnderTheRoot) {
    {
        ScopedEnv root("S2S_ROOT", nullptr);
        EXPECT_STREQ(S2SPath(S2S_PATH_PAIRING_STORE), "/usr/vurn/etc/vurnS2S.info");
    }
    {
        ScopedEnv root("S2S_ROOT", "");
        EXPECT_STREQ(S2SPath("/var/run/rsyncd.pid"), "/var/run/rsyncd.pid");
    }
    const char* kept;
    {
        ScopedEnv root("S2S_ROOT", "/srv/inst1/");
        kept = S2SPath(S2S_PATH_RSYNCD_PID);
        EXPECT_STREQ(kept, "/srv/inst1/var/run/rsyncd.pid");
        EXPECT_STREQ(S2SPath(S2S_PATH_TEMP_TEMPLATE), "/srv/inst1/tmp/S2S/temp.XXXXXX");
        EXPECT_STREQ(S2SPath("relative/path"), "relative/path");
        EXPECT_EQ(S2SPath(nullptr), nullptr);
    }
    {
        ScopedEnv root("S2S_ROOT", "/srv/inst2");
        EXPECT_STREQ(S2SPath(S2S_PATH_KEY_DIR), "/srv/inst2/usr/vurn/etc/.encrypt");
    }
    // A path handed out earlier stays valid and unchanged.
    EXPECT_STREQ(kept, "/srv/inst1/var/run/rsyncd.pid");
}

}  // namespace
