#include "fscanner/fscommon/fields.h"

#include <gtest/gtest.h>

#include <cwchar>
#include <string>

namespace {

TEST(FieldsTest, NewInt32FieldIsNullWithValueZeroUntilAValueIsStored) {
    Int32Field f(L"n");
    EXPECT_TRUE(f.isNull());
    EXPECT_EQ(0u, f.value());
    f.value(0);
    EXPECT_FALSE(f.isNull());
    EXPECT_EQ(0u, f.value());
}

TEST(FieldsTest, TypeNumbersAndSizesAreFixedByClass) {
    Int8Field a(L"a");
    Int16Field b(L"b");
    Int32Field c(L"c");
    Int64Field d(L"d");
    TextField e(L"e");
    HexField f(L"f");
    EXPECT_EQ(1u, a.getType());
    EXPECT_EQ(2u, b.getType());
    EXPECT_EQ(3u, c.getType());
    EXPECT_EQ(4u, d.getType());
    EXPECT_EQ(5u, e.getType());
    EXPECT_EQ(6u, f.getType());
    EXPECT_EQ(5u, a.size());
    EXPECT_EQ(6u, b.size());
    EXPECT_EQ(8u, c.size());
    EXPECT_EQ(12u, d.size());
    e.value(L"abc");
    EXPECT_EQ(8u + 12u, e.size());
    e.value(nullptr);
    EXPECT_EQ(8u, e.size());
    const unsigned char bytes[] = {3, 0xAA, 0xBB, 0xCC};
    f.value(bytes);
    EXPECT_EQ(4u, f.size());
}

TEST(FieldsTest, IntegerFieldsKeepTheirWidth) {
    Int8Field a(L"a");
    a.value(0xFF);
    EXPECT_EQ(0xFF, a.value());
    Int16Field b(L"b");
    b.value(0xFFFF);
    EXPECT_EQ(0xFFFF, b.value());
    Int64Field d(L"d");
    d.value(0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(0xFFFFFFFFFFFFFFFFull, d.value());
}

TEST(FieldsTest, FieldWithNullNameStandsWithNullFlagSet) {
    Int32Field f(nullptr);
    EXPECT_EQ(nullptr, f.getName());
    EXPECT_TRUE(f.isNull());
    EXPECT_FALSE(f.setName(nullptr));
    EXPECT_TRUE(f.setName(L"x"));
    EXPECT_STREQ(L"x", f.getName());
    EXPECT_TRUE(f.setName(L"yy"));
    EXPECT_STREQ(L"yy", f.getName());
}

TEST(FieldsTest, TextOf127CharactersStaysInlineAnd128GoesToTheHeap) {
    TextField t(L"t");
    std::wstring s127(127, L'x');
    std::wstring s128(128, L'y');
    t.value(s127.c_str());
    EXPECT_TRUE(t.isInline());
    EXPECT_EQ(s127, std::wstring(t.value()));
    t.value(s128.c_str());
    EXPECT_FALSE(t.isInline());
    EXPECT_EQ(s128, std::wstring(t.value()));
    t.value(L"short");
    EXPECT_TRUE(t.isInline());
    EXPECT_STREQ(L"short", t.value());
}

TEST(FieldsTest, TextNullValueSetsPointerNullAndKeepsTheFlag) {
    TextField t(L"t");
    t.value(nullptr);
    EXPECT_EQ(nullptr, t.value());
    EXPECT_TRUE(t.isNull());  // still set from construction
    t.value(L"v");
    EXPECT_FALSE(t.isNull());
    t.value(nullptr);
    EXPECT_EQ(nullptr, t.value());
    EXPECT_FALSE(t.isNull());  // a null value leaves the flag as it stands
}

TEST(FieldsTest, TextValueOnNamelessFieldDoesNothing) {
    TextField t;
    t.value(L"ignored");
    EXPECT_STREQ(L"", t.value());
    EXPECT_TRUE(t.isNull());
}

TEST(FieldsTest, TextValueFromItsOwnHeapValueIsSafe) {
    TextField t(L"t");
    std::wstring s(300, L'q');
    t.value(s.c_str());
    t.value(t.value() + 1);  // 299 characters from inside the current block
    EXPECT_EQ(std::wstring(299, L'q'), std::wstring(t.value()));
}

TEST(FieldsTest, TextCopyCopiesNameValueAndNullFlag) {
    TextField a(L"a");
    std::wstring longText(200, L'z');
    a.value(longText.c_str());
    TextField b(a);
    EXPECT_STREQ(L"a", b.getName());
    EXPECT_EQ(longText, std::wstring(b.value()));
    EXPECT_NE(a.value(), b.value());
    EXPECT_FALSE(b.isNull());
    TextField c(L"c");
    c = a;
    EXPECT_STREQ(L"a", c.getName());
    EXPECT_EQ(longText, std::wstring(c.value()));
}

TEST(FieldsTest, HexValueCopiesLengthPrefixedBytes) {
    HexField h(L"h");
    EXPECT_TRUE(h.isNull());
    const unsigned char bytes[] = {2, 0x10, 0x20, 0x99};
    h.value(bytes);
    EXPECT_FALSE(h.isNull());
    ASSERT_NE(nullptr, h.value());
    EXPECT_EQ(2, h.value()[0]);
    EXPECT_EQ(0x10, h.value()[1]);
    EXPECT_EQ(0x20, h.value()[2]);
    EXPECT_EQ(3u, h.size());
    h.value(nullptr);
    EXPECT_EQ(nullptr, h.value());
    HexField nameless;
    nameless.value(bytes);
    EXPECT_TRUE(nameless.isNull());
}

TEST(FieldsTest, NameReturnsTheFirstOfTwoFieldsWithOneName) {
    Fields fs;
    ASSERT_TRUE(fs.add(L"dup", FIELD_INT32));
    ASSERT_TRUE(fs.add(L"dup", FIELD_TEXT));
    Field* f = fs.name(L"dup");
    ASSERT_NE(nullptr, f);
    EXPECT_EQ(fs.at(0), f);
    EXPECT_EQ(FIELD_INT32, f->getType());
    EXPECT_EQ(nullptr, fs.name(L"missing"));
}

TEST(FieldsTest, AddWithTypeZeroOrSevenIsRefusedAndCountUnchanged) {
    Fields fs;
    ASSERT_TRUE(fs.add(L"a", 1));
    EXPECT_FALSE(fs.add(L"b", 0));
    EXPECT_FALSE(fs.add(L"c", 7));
    EXPECT_FALSE(fs.add(nullptr, 3));
    EXPECT_EQ(1u, fs.count());
}

TEST(FieldsTest, AddOfEachTypeMakesThatClass) {
    Fields fs;
    for (unsigned int t = 1; t <= 6; ++t) ASSERT_TRUE(fs.add(L"f", t));
    ASSERT_EQ(6u, fs.count());
    EXPECT_NE(nullptr, dynamic_cast<Int8Field*>(fs.at(0)));
    EXPECT_NE(nullptr, dynamic_cast<Int16Field*>(fs.at(1)));
    EXPECT_NE(nullptr, dynamic_cast<Int32Field*>(fs.at(2)));
    EXPECT_NE(nullptr, dynamic_cast<Int64Field*>(fs.at(3)));
    EXPECT_NE(nullptr, dynamic_cast<TextField*>(fs.at(4)));
    EXPECT_NE(nullptr, dynamic_cast<HexField*>(fs.at(5)));
}

TEST(FieldsTest, AddOfANamelessFieldIsRefused) {
    Fields fs;
    Int32Field nameless;
    EXPECT_FALSE(fs.add(nameless));
    Int32Field named(L"x");
    named.value(42);
    EXPECT_TRUE(fs.add(named));
    ASSERT_EQ(1u, fs.count());
    EXPECT_EQ(42u, static_cast<Int32Field*>(fs.at(0))->value());
    EXPECT_NE(&named, fs.at(0));
}

TEST(FieldsTest, SizeIsTheSumOfFieldSizes) {
    Fields fs;
    EXPECT_EQ(0u, fs.size());
    fs.add(L"a", FIELD_INT8);
    fs.add(L"b", FIELD_INT64);
    fs.add(L"c", FIELD_TEXT);
    static_cast<TextField*>(fs.at(2))->value(L"ab");
    EXPECT_EQ(5u + 12u + 16u, fs.size());
}

TEST(FieldsTest, CopyHoldsIndependentObjects) {
    Fields src;
    src.add(L"n", FIELD_INT32);
    src.add(L"t", FIELD_TEXT);
    static_cast<Int32Field*>(src.at(0))->value(7);
    static_cast<TextField*>(src.at(1))->value(L"orig");
    Fields copy(src);
    ASSERT_EQ(2u, copy.count());
    EXPECT_NE(src.at(0), copy.at(0));
    static_cast<Int32Field*>(copy.at(0))->value(99);
    static_cast<TextField*>(copy.at(1))->value(L"changed");
    EXPECT_EQ(7u, static_cast<Int32Field*>(src.at(0))->value());
    EXPECT_STREQ(L"orig", static_cast<TextField*>(src.at(1))->value());

    Fields assigned;
    assigned.add(L"old", FIELD_INT8);
    assigned = src;
    ASSERT_EQ(2u, assigned.count());
    EXPECT_STREQ(L"n", assigned.at(0)->getName());
    EXPECT_EQ(7u, static_cast<Int32Field*>(assigned.at(0))->value());
}

TEST(FieldsTest, CopyKeepsNullFlags) {
    Fields src;
    src.add(L"a", FIELD_INT16);
    src.add(L"b", FIELD_INT16);
    static_cast<Int16Field*>(src.at(1))->value(3);
    Fields copy(src);
    EXPECT_TRUE(copy.at(0)->isNull());
    EXPECT_FALSE(copy.at(1)->isNull());
}

TEST(FieldsTest, RemoveAllEmptiesTheCollection) {
    Fields fs;
    fs.add(L"a", 1);
    fs.add(L"b", 2);
    fs.removeAll();
    EXPECT_EQ(0u, fs.count());
    EXPECT_EQ(nullptr, fs.name(L"a"));
}

}  // namespace
