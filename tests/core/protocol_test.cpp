// The one share-name rule both ends and the share registry use, and the token line, as a table.
#include <gtest/gtest.h>

#include <string>

#include "core/protocol.h"

namespace {

namespace protocol = S2S::protocol;

struct NameCase {
    std::string name;
    bool valid;     // the registry can hold it
    bool syncable;  // it can be served and synced
};

TEST(ShareNameRule, DecidesEveryKindOfName) {
    const NameCase cases[] = {
        {"docs", true, true},
        {"a b", true, true},
        {"Caf\xc3\xa9", true, true},
        {std::string(255, 'x'), true, true},
        {std::string(256, 'x'), false, false},
        {"", false, false},
        {".", false, false},
        {"..", false, false},
        {" docs", false, false},
        {"docs ", false, false},
        {"a/b", false, false},
        {"a\\b", false, false},
        {"a[b]", false, false},
        {"a\tb", false, false},
        {"a\nb", false, false},
        {"a\x7f", false, false},
        {std::string("a\0b", 3), false, false},
        {"\xc3", false, false},          // cut short
        {"\xc0\xaf", false, false},      // overlong
        {"\xed\xa0\x80", false, false},  // surrogate
        // Valid, but not a module the daemon would serve as itself.
        {"a  b", true, false},  // the daemon makes one blank of the run
        {"@x@", true, false},
        {"GLOBAL", true, false},
        {"glo bal", true, false},
        {"a..b", true, false},
        {"it's", true, false},
        {"say\"hi\"", true, false},
        {"back`tick", true, false},
        {"100%", true, false},
        {"a:b", true, false},  // would split where share names are joined
    };
    for (const NameCase& c : cases) {
        EXPECT_EQ(protocol::ShareNameValid(c.name), c.valid) << c.name;
        EXPECT_EQ(protocol::ShareNameSyncable(c.name), c.syncable) << c.name;
    }
}

TEST(ShareNameRule, ModuleKeysFoldAsciiCaseAndBlanksOnly) {
    EXPECT_EQ(protocol::ShareModuleKey("Do Cs"), "docs");
    EXPECT_EQ(protocol::ShareModuleKey("DOCS"), protocol::ShareModuleKey("d o c s"));
    EXPECT_NE(protocol::ShareModuleKey("CAF\xc3\x89"), protocol::ShareModuleKey("caf\xc3\xa9"));
}

TEST(TokenLine, OnlyAWellFormedTokenLineYieldsItsToken) {
    const std::string token(32, 'a');
    const std::string line = protocol::TokenLine(token);
    EXPECT_EQ(line, "token=\"" + token + "\"\n");
    EXPECT_EQ(protocol::TokenOfLine(line.substr(0, line.size() - 1)), token);
    for (const std::string& bad :
         {line, "token=\"" + std::string(31, 'a') + "\"", "token=\"" + std::string(32, 'A') + "\"",
          "tokens=\"" + token + "\"", "token=\"" + token}) {
        EXPECT_EQ(protocol::TokenOfLine(bad), "") << bad;
    }
}

}  // namespace
