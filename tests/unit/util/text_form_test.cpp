#include <memory>

#include <gtest/gtest.h>

#include <bluetooth/util.h>

using namespace Bluetooth;

namespace {

Variant text(const char* value) { return Variant(std::string(value)); }

std::unique_ptr<Dict> divide(const std::string& input, const std::string& separators) {
    return std::unique_ptr<Dict>(stringDivideToDict(input, separators));
}

TEST(TheTextForm, WritesEveryAlternativeBare) {
    EXPECT_EQ(variantToString(Variant(4294967295u)), "4294967295");
    EXPECT_EQ(variantToString(Variant(0u)), "0");
    EXPECT_EQ(variantToString(Variant(static_cast<unsigned short>(65535))), "65535");
    EXPECT_EQ(variantToString(Variant(true)), "1");
    EXPECT_EQ(variantToString(Variant(false)), "0");
    EXPECT_EQ(variantToString(text("a, \"b\"]")), "a, \"b\"]");
    EXPECT_EQ(variantToString(Variant(std::vector<std::string>())), "[]");
    EXPECT_EQ(variantToString(Variant(std::vector<std::string>{ "x" })), "[x]");
    EXPECT_EQ(variantToString(Variant(std::vector<std::string>{ "a", "b, c" })), "[a, b, c]");
    EXPECT_EQ(variantToString(Variant(-1)), "-1");
    EXPECT_EQ(variantToString(Variant(-2147483647 - 1)), "-2147483648");
    EXPECT_EQ(variantToString(Variant()), "0");
}

TEST(TheTextForm, ReadsABooleanOnlyFromTheBooleanAlternative) {
    EXPECT_TRUE(variantToBool(Variant(true)));
    EXPECT_FALSE(variantToBool(Variant(false)));
    EXPECT_FALSE(variantToBool(text("true")));
    EXPECT_FALSE(variantToBool(Variant(1u)));
    EXPECT_FALSE(variantToBool(Variant(1)));
}

TEST(TheTextForm, WritesDictionariesWithAClosingSeparatorAfterEachEntry) {
    Dict dict{ Entry("Address", text("00:11:22:33:44:55")), Entry("Class", Variant(7936u)),
               Entry("Paired", Variant(false)) };
    std::string semicolon = ";";
    EXPECT_EQ(dictConquerToString(dict, semicolon), "Address: 00:11:22:33:44:55;Class: 7936;Paired: 0;");
    EXPECT_EQ(semicolon, ";");
    EXPECT_EQ(dictToString(dict), "Address: 00:11:22:33:44:55\nClass: 7936\nPaired: 0\n");

    std::string any = "<>";
    EXPECT_EQ(dictToString(Dict()), "");
    EXPECT_EQ(dictConquerToString(Dict(), any), "");
}

TEST(TheTextForm, FindsTheFirstEntryOfAName) {
    Dict dict{ Entry("Name", text("first")), Entry("name", text("lower")), Entry("Name", text("second")),
               Entry("Empty", text("")) };
    EXPECT_EQ(find(&dict, "Name"), "first");
    EXPECT_EQ(find(&dict, "name"), "lower");
    EXPECT_EQ(find(&dict, "Nam"), "");
    EXPECT_EQ(find(&dict, "Empty"), "");
    EXPECT_EQ(find(nullptr, "Name"), "");
    EXPECT_EQ(find(&dict, nullptr), "");
}

TEST(TheTextForm, ParsesAnEntryAtItsFirstColonAndTrimsBothSides) {
    std::unique_ptr<Entry> entry(stringToEntry("  Name  :  some value  "));
    ASSERT_TRUE(entry);
    EXPECT_EQ(entry->first, "Name");
    EXPECT_EQ(boost::get<std::string>(entry->second), "some value");

    entry.reset(stringToEntry("Address: 00:11:22:33:44:55"));
    ASSERT_TRUE(entry);
    EXPECT_EQ(boost::get<std::string>(entry->second), "00:11:22:33:44:55");

    entry.reset(stringToEntry("\t\r\v\fClass:\n7936 \n"));
    ASSERT_TRUE(entry);
    EXPECT_EQ(entry->first, "Class");
    EXPECT_EQ(entry->second.which(), 3);  // never a number
    EXPECT_EQ(boost::get<std::string>(entry->second), "7936");

    entry.reset(stringToEntry(":x"));
    ASSERT_TRUE(entry);
    EXPECT_EQ(entry->first, "");
    entry.reset(stringToEntry("Name:"));
    ASSERT_TRUE(entry);
    EXPECT_EQ(boost::get<std::string>(entry->second), "");

    EXPECT_EQ(stringToEntry("no colon"), nullptr);
    EXPECT_EQ(stringToEntry(""), nullptr);
}

TEST(TheTextForm, ReadsOnlyEntriesClosedByASeparator) {
    EXPECT_FALSE(divide("A: 1", ";"));
    EXPECT_FALSE(divide("x;y;", ";"));
    EXPECT_FALSE(divide("", ";"));
    EXPECT_FALSE(divide("A: 1;", ""));

    auto dict = divide("A: 1;B: 2", ";");
    ASSERT_TRUE(dict);
    ASSERT_EQ(dict->size(), 1u);
    EXPECT_EQ(dict->at(0).first, "A");

    dict = divide("A: 1;;B:2;", ";");
    ASSERT_TRUE(dict);
    ASSERT_EQ(dict->size(), 2u);
    EXPECT_EQ(boost::get<std::string>(dict->at(1).second), "2");

    dict = divide("junk;A: 1,B: 2;", ";,");
    ASSERT_TRUE(dict);
    ASSERT_EQ(dict->size(), 2u);
    EXPECT_EQ(dict->at(0).first, "A");
    EXPECT_EQ(dict->at(1).first, "B");
}

TEST(TheTextForm, RoundTripsADictionaryAsStrings) {
    Dict dict{ Entry("Address", text("00:11:22:33:44:55")), Entry("Class", Variant(7936u)),
               Entry("RSSI", Variant(-60)), Entry("Paired", Variant(true)),
               Entry("UUIDs", Variant(std::vector<std::string>{ "110b", "110e" })),
               Entry("Vendor", Variant(static_cast<unsigned short>(29))), Entry("Name", text("")),
               Entry("Class", Variant(1u)) };
    std::string separator = ";";
    auto back = divide(dictConquerToString(dict, separator), separator);
    ASSERT_TRUE(back);
    ASSERT_EQ(back->size(), dict.size());
    for (size_t i = 0; i < dict.size(); ++i) {
        EXPECT_EQ(back->at(i).first, dict[i].first);
        EXPECT_EQ(back->at(i).second.which(), 3);
        EXPECT_EQ(boost::get<std::string>(back->at(i).second), variantToString(dict[i].second));
    }

    auto lines = divide(dictToString(dict), "\n");
    ASSERT_TRUE(lines);
    EXPECT_EQ(lines->size(), dict.size());
}

TEST(TheTextForm, CutsAValueThatHoldsTheSeparator) {
    Dict dict{ Entry("Name", text("a;b")), Entry("Alias", text("c;D: e")) };
    std::string separator = ";";
    auto back = divide(dictConquerToString(dict, separator), separator);
    ASSERT_TRUE(back);
    ASSERT_EQ(back->size(), 3u);  // "b" is dropped; "D: e" becomes an entry of its own
    EXPECT_EQ(boost::get<std::string>(back->at(0).second), "a");
    EXPECT_EQ(back->at(2).first, "D");
}

}  // namespace
