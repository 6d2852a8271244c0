#include <gtest/gtest.h>

#include <stdexcept>
#include <string>

#include "s2s_pobject.h"

using S2S::PObject;

namespace {

// Catches the non-const integer index failing with the one exception text callers match on.
template <typename F>
void ExpectIndexThrow(F&& f) {
    try {
        f();
        FAIL() << "no exception";
    } catch (const std::out_of_range& e) {
        EXPECT_STREQ(e.what(), "out_of_range: PObject::operator[]");
    }
}

}  // namespace

TEST(PObjectConversion, NullReadsAsNothing) {
    const PObject o;
    EXPECT_TRUE(o.isNull());
    EXPECT_TRUE(o.isEmpty());
    EXPECT_FALSE(o.asBool());
    EXPECT_EQ(o.toString(), "null");
    EXPECT_EQ(o.asString(), "");
    EXPECT_EQ(o.asUInt64(), 0u);
    EXPECT_TRUE(o.asArray().empty());
    EXPECT_TRUE(o.asMap().empty());
    EXPECT_EQ(&o.asArray(), &PObject::GetEmptyArray());
    EXPECT_EQ(&o.asMap(), &PObject::GetEmptyMap());
}

TEST(PObjectConversion, IntegerWidthsAndText) {
    PObject zero(0ULL);
    EXPECT_FALSE(zero.isEmpty());
    EXPECT_FALSE(zero.asBool());
    EXPECT_TRUE(zero.isPrimitive());

    PObject big(4294967296ULL);
    EXPECT_TRUE(big.asBool());
    EXPECT_EQ(big.asUInt32(), 0u);
    EXPECT_EQ(big.asString(), "0");  // only the low 32 bits are printed by asString
    EXPECT_EQ(big.toString(), "4294967296");

    PObject neg;
    neg = -2;
    EXPECT_EQ(neg.asInt64(), -2);
    EXPECT_EQ(neg.asInt32(), -2);
    EXPECT_EQ(neg.asUInt16(), 65534);
    EXPECT_EQ(neg.asInt8(), -2);
    EXPECT_EQ(neg.asString(), "4294967294");
    neg = -1;
    EXPECT_EQ(neg.asUInt64(), 18446744073709551615ULL);
    EXPECT_EQ(neg.toString(), "18446744073709551615");
    EXPECT_EQ(neg.asString(), "4294967295");

    PObject word;
    word = 65535u;
    EXPECT_EQ(word.asInt16(), -1);
    EXPECT_EQ(word.asUInt8(), 255);
    word = true;
    EXPECT_EQ(word.asUInt64(), 1u);
    word = false;
    EXPECT_TRUE(word.isInteger());
    EXPECT_FALSE(word.asBool());
}

TEST(PObjectConversion, BoolOfOtherKindsIsNonEmptiness) {
    EXPECT_TRUE(PObject("0").asBool());
    EXPECT_FALSE(PObject("").asBool());
    PObject array;
    array.asArray();
    EXPECT_FALSE(array.asBool());
    array.asArray().push_back(PObject());
    EXPECT_TRUE(array.asBool());
    EXPECT_EQ(PObject("abc").asUInt64(), 0u);
}

TEST(PObjectConversion, StringsKeepEveryByte) {
    std::string bytes("a\0b", 3);
    PObject s(bytes);
    EXPECT_EQ(s.asString().size(), 3u);
    EXPECT_EQ(s.toString(), std::string("\"a\0b\"", 5));
    PObject quoted("a\"b");
    EXPECT_EQ(quoted.toString(), "\"a\"b\"");  // nothing is escaped
}

TEST(PObjectIndex, StringIndexOnNonMap) {
    PObject s("text");
    const PObject& cs = s;
    EXPECT_TRUE(cs["k"].isNull());
    EXPECT_TRUE(s.isString());  // the const form changes nothing
    EXPECT_EQ(&cs["k"], &PObject::GetEmptyObject());

    s["k"];
    EXPECT_TRUE(s.isMap());
    EXPECT_TRUE(s.hasMember("k"));
    EXPECT_TRUE(s["k"].isNull());

    PObject array;
    array.asArray().push_back(PObject(1ULL));
    array["x"] = 5;
    EXPECT_TRUE(array.isMap());
    EXPECT_EQ(array.asMap().size(), 1u);
}

TEST(PObjectIndex, HasMemberOnlyOnMaps) {
    PObject array;
    array.asArray();
    EXPECT_FALSE(array.hasMember("a"));
    EXPECT_FALSE(PObject("a").hasMember("a"));
    EXPECT_FALSE(PObject().hasMember("a"));
    PObject map;
    map["a"] = 1;
    EXPECT_TRUE(map.hasMember("a"));
    EXPECT_FALSE(map.hasMember("b"));
}

TEST(PObjectIndex, IntegerIndexOnArrays) {
    PObject array;
    for (unsigned i = 0; i < 5; ++i) {
        PObject element;
        element = i;
        array.asArray().push_back(element);
    }
    const PObject& ca = array;
    EXPECT_EQ(ca[4u].asUInt64(), 4u);
    EXPECT_TRUE(ca[5u].isNull());
    ExpectIndexThrow([&] { array[0u]; });  // the mutable form never reaches array elements
    EXPECT_EQ(array.asArray().size(), 5u);
}

TEST(PObjectIndex, IntegerIndexOnMapsWalksKeyOrder) {
    PObject map;
    map["b"] = 2;
    map["a"] = 1;
    const PObject& cm = map;
    EXPECT_EQ(cm[0u].asUInt64(), 1u);
    EXPECT_EQ(cm[1u].asUInt64(), 2u);
    EXPECT_TRUE(cm[2u].isNull());
    EXPECT_TRUE(cm[static_cast<unsigned>(-1)].isNull());
    map[1u] = 7;
    EXPECT_EQ(cm["b"].asUInt64(), 7u);
    ExpectIndexThrow([&] { map[2u]; });
    ExpectIndexThrow([&] { PObject("s")[0u]; });
    ExpectIndexThrow([&] { PObject()[0u]; });
    EXPECT_EQ(map.asMap().size(), 2u);  // never inserts
}

TEST(PObjectCopy, DeepCopiesAreIndependent) {
    PObject tree;
    tree["list"].asArray().push_back(PObject("x"));
    tree["n"] = 3;
    PObject other(tree);
    other["list"].asArray().push_back(PObject("y"));
    other["n"] = 4;
    EXPECT_EQ(tree["list"].asArray().size(), 1u);
    EXPECT_EQ(tree["n"].asUInt64(), 3u);
    EXPECT_EQ(other.toString(), "{\"list\": [\"x\", \"y\"], \"n\": 4}");
}

TEST(PObjectCopy, SelfAssignmentClearsButTypedSelfCopyIsSafe) {
    PObject o("value");
    PObject& alias = o;
    o = alias;
    EXPECT_TRUE(o.isNull());

    PObject array;
    array.asArray().push_back(PObject("a"));
    array.asArray().push_back(PObject("b"));
    array = array.asArray();
    EXPECT_EQ(array.toString(), "[\"a\", \"b\"]");

    PObject map;
    map["k"] = "inner";
    map = map["k"].asString();
    EXPECT_EQ(map.asString(), "inner");
}

TEST(PObjectCopy, ClearSwapAndMoves) {
    PObject a("a");
    PObject b;
    b = 9;
    a.swap(b);
    EXPECT_EQ(a.asUInt64(), 9u);
    EXPECT_EQ(b.asString(), "a");
    PObject moved(std::move(b));
    EXPECT_EQ(moved.asString(), "a");
    EXPECT_TRUE(b.isNull());
    moved.clear();
    EXPECT_TRUE(moved.isNull());
    EXPECT_FALSE(moved.isString());
}

TEST(PObjectText, NestedExampleAndEmpties) {
    PObject map;
    map["a"] = 1;
    map["b"].asArray().push_back(PObject("x"));
    map["b"].asArray().push_back(PObject());
    EXPECT_EQ(map.toString(), "{\"a\": 1, \"b\": [\"x\", null]}");
    PObject empty_map;
    empty_map.asMap();
    EXPECT_EQ(empty_map.toString(), "{}");
    PObject empty_array;
    empty_array.asArray();
    EXPECT_EQ(empty_array.toString(), "[]");
}

TEST(PObjectText, MapKeysSortAsUnsignedBytes) {
    PObject map;
    map["\xff"] = 1;
    map["a"] = 2;
    map["ab"] = 3;
    map[""] = 4;
    std::string keys;
    for (const auto& entry : map.asMap()) {
        keys += "<" + entry.first + ">";
    }
    EXPECT_EQ(keys, "<><a><ab><\xff>");
}

TEST(PObjectTypeTrait, StorageTypeCodes) {
    EXPECT_EQ(PObject::type_trait<PObject::Array>(), 1);
    EXPECT_EQ(PObject::type_trait<PObject::Map>(), 2);
    EXPECT_EQ(PObject::type_trait<unsigned long long>(), 3);
    EXPECT_EQ(PObject::type_trait<std::string>(), 4);
}

TEST(PObjectDepth, VeryDeepTreeIsCopiedPrintedAndReleasedWithoutRecursion) {
    // Each of these would overflow the stack if it recursed.
    const int depth = 1000000;
    PObject root;
    PObject* cursor = &root;
    for (int i = 0; i < depth; ++i) {
        cursor = &(*cursor)["k"].asArray().emplace_back();
    }
    *cursor = 7ULL;
    PObject copy(root);
    std::string text = copy.toString();
    EXPECT_EQ(text.size(), depth * std::string("{\"k\": []}").size() + 1);
    EXPECT_EQ(text.substr(0, 12), "{\"k\": [{\"k\":");
    EXPECT_EQ(text.substr(depth * 7 - 4, 8), "\": [7]}]");
    root.clear();
    EXPECT_TRUE(root.isNull());
    EXPECT_FALSE(copy.isNull());  // the copy owns its own tree
}
