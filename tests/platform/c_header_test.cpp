// The platform header must serve C programs: a C11 program including it is compiled with the
// project's warnings, linked against the library and run.
#include <sys/wait.h>

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "support/test_util.h"

namespace {

const char kProgram[] = R"(#include <stdio.h>
#include <string.h>
#include "s2s_platform.h"

int main(int argc, char** argv) {
    VLIBSzHash* hash = VLIBCSzHashAlloc(4);
    VLIBSzList* list = VLIBCSzListAlloc(4);
    char buf[64];
    char* name;
    int ok;
    (void)argc;
    if (hash == NULL || list == NULL) return 1;
    if (VLIBCSzHashSetValue(&hash, "clientID", "C-ID") < 0) return 2;
    if (VLIBCFileAddSection(argv[1], "PairedClientInfo", hash, VLIB_SECTION_LINE_FORMAT) != 1)
        return 3;
    if (VLIBCFileGetSectionValue(argv[1], "PairedClientInfo", "clientID", buf, sizeof buf) != 4)
        return 4;
    if (VLIBCFileEnumSection(argv[1], &list) != 1) return 5;
    name = VLIBCStrGet("SHARE_%s", "docs");
    ok = name != NULL && strcmp(name, "SHARE_docs") == 0 && strcmp(buf, "C-ID") == 0;
    VLIBCStrPut(name);
    VLIBCSzListFree(list);
    VLIBCSzHashFree(hash);
    return ok && S2SPath(S2S_PATH_PAIRING_STORE) != NULL ? 0 : 6;
}
)";

// The library of a sanitizer build needs the sanitizer runtimes at link time.
#if defined(__SANITIZE_ADDRESS__)
const char kLinkExtra[] = " -fsanitize=address,undefined";
#else
const char kLinkExtra[] = "";
#endif

int Shell(const std::string& command) {
    int status = std::system(command.c_str());
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(CHeader, ACProgramCompilesLinksAndRuns) {
    if (Shell("command -v cc >/dev/null 2>&1") != 0) {
        GTEST_SKIP() << "no C compiler";
    }
    s2s_test::TempDir dir;
    s2s_test::WriteFile(dir / "prog.c", kProgram);
    std::string compile = "cc -std=c11 -Wall -Wextra -Wpedantic -Werror -I'" S2S_SOURCE_DIR
                          "/include' -c '" +
                          (dir / "prog.c") + "' -o '" + (dir / "prog.o") + "'";
    ASSERT_EQ(Shell(compile), 0) << compile;
    std::string link = "c++ '" + (dir / "prog.o") +
                       "' -L'" S2S_BINARY_DIR "' -ls2s -Wl,-rpath,'" S2S_BINARY_DIR "' -pthread" +
                       std::string(kLinkExtra) + " -o '" + (dir / "prog") + "'";
    ASSERT_EQ(Shell(link), 0) << link;
    EXPECT_EQ(Shell("'" + (dir / "prog") + "' '" + (dir / "store.info") + "'"), 0);
    EXPECT_EQ(s2s_test::ReadFile(dir / "store.info"), "[PairedClientInfo]\n\tclientID=\"C-ID\"\n");
}

}  // namespace
