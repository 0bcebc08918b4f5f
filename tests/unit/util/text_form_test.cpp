// Writing values and dictionaries as text, and finding an entry. The parsers are checked against
// a model of their rules by the text form's fuzz target, whose corpus make check replays.
#include <gtest/gtest.h>

#include <bluetooth/util.h>

using namespace Bluetooth;

namespace {

Variant text(const char* value) { return Variant(std::string(value)); }

// Most alternatives' texts are also checked on replies decoded over the bus.
TEST(TheTextForm, WritesEveryAlternativeBare) {
    EXPECT_EQ(variantToString(Variant(4294967295u)), "4294967295");
    EXPECT_EQ(variantToString(text("a, \"b\"]")), "a, \"b\"]");
    EXPECT_EQ(variantToString(Variant(std::vector<std::string>{ "x" })), "[x]");
    EXPECT_EQ(variantToString(Variant(std::vector<std::string>{ "a", "b, c" })), "[a, b, c]");
    EXPECT_EQ(variantToString(Variant(-2147483647 - 1)), "-2147483648");
    // The default value is the first alternative's zero.
    EXPECT_EQ(Variant().which(), 0);
    EXPECT_EQ(variantToString(Variant()), "0");
}

// True and false themselves reach btbusctl's output.
TEST(TheTextForm, ReadsABooleanOnlyFromTheBooleanAlternative) {
    EXPECT_FALSE(variantToBool(text("true")));
    EXPECT_FALSE(variantToBool(Variant(1u)));
    EXPECT_FALSE(variantToBool(Variant(1)));
}

TEST(TheTextForm, WritesDictionariesWithAClosingSeparatorAfterEachEntry) {
    Dict dict{ Entry("Address", text("00:11:22:33:44:55")), Entry("Class", Variant(7936u)),
               Entry("Name", text("a;b")) };
    std::string semicolon = ";";
    EXPECT_EQ(dictConquerToString(dict, semicolon), "Address: 00:11:22:33:44:55;Class: 7936;Name: a;b;");
    EXPECT_EQ(semicolon, ";");
    EXPECT_EQ(dictToString(dict), "Address: 00:11:22:33:44:55\nClass: 7936\nName: a;b\n");
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

}  // namespace
