// The platform's C interface: string tables, lists and strings, the per-thread last error, fixed
// paths moved below S2S_ROOT, and every function of the C headers exported under its plain C name
// (that the headers compile as C is checked on the installed headers, in tests/install).
#include <dlfcn.h>

#include <gtest/gtest.h>

#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <tuple>

#include "s2s_platform.h"
#include "support/test_util.h"

namespace {

TEST(Containers, HashesKeepOrderAndIndexAcrossGrowthReplaceAndRemoveAndRefuseNulls) {
    VLIBSzHash* hash = VLIBCSzHashAlloc(2);
    for (int i = 0; i < 100; ++i) {  // grows past the size it was allocated with
        std::string key = "k" + std::to_string(i);
        ASSERT_EQ(VLIBCSzHashSetValue(&hash, key.c_str(), key.c_str()), 0);
    }
    ASSERT_EQ(VLIBCSzHashSetValue(&hash, "k5", "five"), 0);
    EXPECT_EQ(VLIBCSzHashCount(hash), 100);
    EXPECT_STREQ(VLIBCSzHashKeyAt(hash, 5), "k5");  // replacing keeps the position
    EXPECT_EQ(VLIBCSzHashRemove(hash, "k0"), 0);
    EXPECT_LT(VLIBCSzHashRemove(hash, "k0"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_NOT_FOUND);
    EXPECT_STREQ(VLIBCSzHashKeyAt(hash, 0), "k1");
    EXPECT_STREQ(VLIBCSzHashGetValue(hash, "k99"), "k99");  // the index is right after removal
    EXPECT_STREQ(VLIBCSzHashValueAt(hash, 4), "five");
    EXPECT_LT(VLIBCSzHashSetValue(&hash, "", "v"), 0);
    EXPECT_EQ(VLIBCErrGet(), VLIB_ERR_BAD_PARAMETER);
    VLIBCHashRemoveAll(hash);
    EXPECT_EQ(VLIBCSzHashGetValue(hash, "k5"), nullptr);
    VLIBCSzHashFree(hash);

    // Callers of the C interface pass nulls and bad sizes: each is refused, nothing crashes.
    VLIBSzHash* no_hash = nullptr;
    VLIBSzList* no_list = nullptr;
    EXPECT_TRUE(VLIBCSzHashSetValue(&no_hash, "k", "v") < 0 && VLIBCSzHashRemove(nullptr, "k") < 0);
    EXPECT_TRUE(VLIBCSzHashSetValue(nullptr, "k", "v") < 0 && VLIBCSzListPush(&no_list, "x") < 0);
    EXPECT_EQ(VLIBCSzHashGetValue(nullptr, "k"), nullptr);
    EXPECT_EQ(VLIBCSzHashKeyAt(nullptr, -1), nullptr);
    EXPECT_EQ(VLIBCSzHashAlloc(-1), nullptr);
    EXPECT_EQ(VLIBCSzListAlloc(-1), nullptr);
    EXPECT_TRUE(VLIBCSzListCount(nullptr) + VLIBCSzHashCount(nullptr) == 0 &&
                !VLIBCSzListGet(nullptr, 0));
    VLIBCSzHashFree(nullptr), VLIBCHashRemoveAll(nullptr), VLIBCStrPut(nullptr);  // ignored
    VLIBCSzListFree(nullptr), VLIBCSzListRemoveAll(nullptr);
    EXPECT_STREQ(VLIBCErrStr(0x1234), "Unknown error");
    EXPECT_STREQ(VLIBCErrStr(VLIB_ERR_NOT_FOUND), "No such section, key or share");

    // Strings have no fixed limit; the last error is per thread.
    std::string big(100000, 'z');
    char* s = VLIBCStrGet("SHARE_%s", big.c_str());
    EXPECT_EQ(std::string(s), "SHARE_" + big);
    VLIBCStrPut(s);
    VLIBCErrSet(0xEB00);
    int other = -1;
    std::thread([&] { other = VLIBCErrGet(); }).join();
    EXPECT_EQ(other, 0);
    EXPECT_EQ(VLIBCErrGet(), 0xEB00);
}

TEST(S2SPath, MovesFixedPathsBelowTheRootAndKeepsEarlierResults) {
    const std::tuple<const char*, const char*, const char*> cases[] = {
        {nullptr, S2S_PATH_PAIRING_STORE, "/usr/vurn/etc/vurnS2S.info"},
        {"", "/var/run/rsyncd.pid", "/var/run/rsyncd.pid"},
        {"/srv/inst1/", S2S_PATH_RSYNCD_PID, "/srv/inst1/var/run/rsyncd.pid"},
        {"/srv/inst1", S2S_PATH_TEMP_TEMPLATE, "/srv/inst1/tmp/S2S/temp.XXXXXX"},
        {"/srv/inst1", "relative/path", "relative/path"},
        {"/srv/inst2", S2S_PATH_KEY_DIR, "/srv/inst2/usr/vurn/etc/.encrypt"},
    };
    const char* first = nullptr;
    for (const auto& [root, path, expected] : cases) {
        s2s_test::ScopedEnv env("S2S_ROOT", root);
        const char* got = S2SPath(path);
        EXPECT_STREQ(got, expected);
        first = first != nullptr ? first : got;
    }
    EXPECT_STREQ(first, "/usr/vurn/etc/vurnS2S.info");  // still valid, unchanged
    EXPECT_EQ(S2SPath(nullptr), nullptr);
}

TEST(CInterface, EveryDeclaredFunctionIsExportedUnmangled) {
    void* lib = dlopen(S2S_LIBRARY_DIR "/libs2s.so", RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(lib, nullptr) << dlerror();
    // A function declaration starts a line: its type, then its name and "(".
    const std::regex declaration("^(?:S2S_EXPORT )?(?:const )?\\w+\\**\\s+\\**(\\w+)\\(");
    int checked = 0;
    for (const std::string header : {"s2s_platform.h", "s2s_server.h"}) {
        std::istringstream lines(s2s_test::ReadFile(S2S_SOURCE_DIR "/include/" + header));
        std::smatch name;
        for (std::string line; std::getline(lines, line);) {
            if (std::regex_search(line, name, declaration)) {
                EXPECT_NE(dlsym(lib, name[1].str().c_str()), nullptr) << header << ": " << name[1];
                ++checked;
            }
        }
    }
    EXPECT_GT(checked, 70);
    dlclose(lib);
}

}  // namespace
