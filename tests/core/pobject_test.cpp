// PObject, the value type of local messages, through its interface: conversions between kinds and
// widths, truth, bytes kept in strings, the const and mutable index forms (and the exception text
// callers match on), deep copies, the self-assignment quirk, text form and key order, deep trees.
#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "s2s_pobject.h"

using S2S::PObject;

namespace {
void ExpectIndexThrow(const std::function<void()>& f) {
    try {
        f();
        ADD_FAILURE() << "no exception";
    } catch (const std::out_of_range& e) {
        EXPECT_STREQ(e.what(), "out_of_range: PObject::operator[]");
    }
}

PObject Int(int v) {
    PObject o;
    o = v;
    return o;
}

TEST(PObject, ConversionsBetweenKindsAndWidths) {
    PObject array, full, flag;
    array.asArray();
    full.asArray().push_back(PObject());
    flag = false;
    const std::string nul("a\0b", 3);
    struct Case {
        PObject value;
        std::string as_string, text;
        unsigned long long u64;
        bool truth;
    };
    const Case cases[] = {
        {PObject(), "", "null", 0, false},
        {PObject(0ULL), "0", "0", 0, false},
        {flag, "0", "0", 0, false},
        {PObject(4294967296ULL), "0", "4294967296", 4294967296ULL, true},  // asString: low 32 bits
        {Int(-2), "4294967294", "18446744073709551614", 18446744073709551614ULL, true},
        {PObject("0"), "0", "\"0\"", 0, true},  // other kinds: true when not empty
        {PObject(""), "", "\"\"", 0, false},
        {PObject("a\"b"), "a\"b", "\"a\"b\"", 0, true},  // nothing is escaped
        {PObject(nul), nul, "\"" + nul + "\"", 0, true},
        {array, "", "[]", 0, false},
        {full, "", "[null]", 0, true},
    };
    for (const Case& c : cases) {
        EXPECT_EQ(c.as_string, c.value.asString()) << c.text;
        EXPECT_EQ(c.text, c.value.toString());
        EXPECT_EQ(c.u64, c.value.asUInt64()) << c.text;
        EXPECT_EQ(c.truth, c.value.asBool()) << c.text;
    }
    EXPECT_TRUE(PObject().isEmpty() && !PObject(0ULL).isEmpty() && flag.isInteger());
    EXPECT_EQ(std::vector<long long>({-2, 65534, -2, -1, 255, 0}),
              std::vector<long long>({Int(-2).asInt32(), Int(-2).asUInt16(), Int(-2).asInt8(),
                                      Int(65535).asInt16(), Int(65535).asUInt8(),
                                      PObject(4294967296ULL).asUInt32()}));
}

TEST(PObject, ConstIndexNeverChangesMutableIndexMakesMapsAndIntegerIndexWalksKeyOrder) {
    PObject s("text");
    const PObject& cs = s;
    EXPECT_TRUE(cs["k"].isNull() && s.isString() && !s.hasMember("k"));
    s["k"];  // the mutable form turns anything into a map
    EXPECT_TRUE(s.isMap() && s.hasMember("k") && !s.hasMember("x"));
    PObject array;
    array.asArray() = {Int(0), Int(1), Int(2)};
    const PObject& ca = array;
    EXPECT_EQ(2u, ca[2u].asUInt64());
    EXPECT_TRUE(ca[3u].isNull() && !array.hasMember("0"));
    ExpectIndexThrow([&] { array[0u]; });  // the mutable form never reaches array elements
    PObject map;
    map["b"] = 2;
    map["a"] = 1;
    const PObject& cm = map;
    EXPECT_TRUE(cm[0u].asUInt64() == 1 && cm[2u].isNull());
    map[1u] = 7;
    EXPECT_EQ(7u, cm["b"].asUInt64());
    ExpectIndexThrow([&] { map[2u]; });
    ExpectIndexThrow([&] { PObject()[0u]; });
    EXPECT_EQ(2u, map.asMap().size());  // never inserts
}

TEST(PObject, CopiesAreDeepAndSelfAssignmentClearsButTypedSelfCopyIsSafe) {
    PObject tree;
    tree["list"].asArray().push_back(PObject("x"));
    tree["n"] = 3;
    PObject other(tree);
    other["list"].asArray().push_back(PObject());
    other["n"] = 4;
    EXPECT_EQ("{\"list\": [\"x\"], \"n\": 3}", tree.toString());
    EXPECT_EQ("{\"list\": [\"x\", null], \"n\": 4}", other.toString());
    tree = static_cast<const PObject&>(tree);  // self-assignment clears
    EXPECT_TRUE(tree.isNull());
    other = other["list"].asArray();
    PObject moved(std::move(other));
    moved.swap(other);
    EXPECT_EQ("[\"x\", null]", other.toString());
    PObject keys;
    for (const char* key : {"\xff", "a", "ab", ""}) {
        keys[key] = 1;
    }
    EXPECT_EQ("{\"\": 1, \"a\": 1, \"ab\": 1, \"\xff\": 1}", keys.toString());  // unsigned bytes
}

TEST(PObject, VeryDeepTreeIsCopiedPrintedAndReleasedWithoutRecursion) {
    const int depth = 1000000;  // each step would overflow the stack if it recursed
    PObject root;
    PObject* cursor = &root;
    for (int i = 0; i < depth; ++i) {
        cursor = &(*cursor)["k"].asArray().emplace_back();
    }
    *cursor = 7ULL;
    PObject copy(root);
    const std::string text = copy.toString();
    EXPECT_EQ(text.size(), depth * std::string("{\"k\": []}").size() + 1);
    EXPECT_EQ(text.substr(depth * 7 - 4, 8), "\": [7]}]");
    root.clear();
    EXPECT_TRUE(root.isNull() && !copy.isNull());
}

}  // namespace
