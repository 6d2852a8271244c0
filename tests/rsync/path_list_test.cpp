// The changed paths of a real-time run, settled against the tree as it stands.
#include "rsync/path_list.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "support/test_util.h"

namespace {

TEST(SettledPaths, PathsBelowAFolderThatIsNowAFileOrGoneBecomeThatComponent) {
    s2s_test::TempDir dir;
    const std::string root = dir.path();
    s2s_test::WriteFile(root + "/d2", "a file where a folder was");
    ASSERT_EQ(mkdir((root + "/kept").c_str(), 0755), 0);
    ASSERT_EQ(mkdir((root + "/kept/sub").c_str(), 0755), 0);
    const std::vector<std::string> settled = S2S::SettledPaths(
        root, {"d2/sub/g1", "d2/sub/g2", "kept/sub/new", "gone/deep/x", "top", "d2"});
    EXPECT_EQ(settled, (std::vector<std::string>{"d2", "gone", "kept/sub/new", "top"}));
}

}  // namespace
