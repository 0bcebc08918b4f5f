#include <memory>

#include <gtest/gtest.h>

#include <bluetooth/util.h>

using namespace Bluetooth;

namespace {

Variant text(const char* value) { return Variant(std::string(value)); }

std::unique_ptr<Dict> divide(const std::string& input, const std::string& separators) {
    return std::unique_ptr<Dict>(stringDivideToDict(input, separators));
}

// The entries as name=value; with # before a value that is not a string; "null" for none.
std::string described(const Dict* dict) {
    if (dict == nullptr) return "null";
    std::string entries;
    for (const Entry& entry : *dict)
        entries += entry.first + (entry.second.which() == 3 ? "=" : "=#") + variantToString(entry.second) + ";";
    return entries;
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
    const struct {
        const char* input;
        const char* entry;
    } kCases[] = {
        { "  Name  :  some value  ", "Name=some value;" },
        { "Address: 00:11:22:33:44:55", "Address=00:11:22:33:44:55;" },
        { "\t\r\v\fClass:\n7936 \n", "Class=7936;" },  // never a number
        { ":x", "=x;" },
        { "Name:", "Name=;" },
        { "no colon", "null" },
        { "", "null" },
    };
    for (const auto& row : kCases) {
        std::unique_ptr<Entry> entry(stringToEntry(row.input));
        Dict one;
        if (entry) one.push_back(*entry);
        EXPECT_EQ(described(entry ? &one : nullptr), row.entry) << row.input;
    }
}

TEST(TheTextForm, ReadsOnlyEntriesClosedByASeparator) {
    const struct {
        const char* input;
        const char* separators;
        const char* entries;
    } kCases[] = {
        { "A: 1", ";", "null" },
        { "x;y;", ";", "null" },
        { "", ";", "null" },
        { "A: 1;", "", "null" },
        { "A: 1;B: 2", ";", "A=1;" },
        { "A: 1;;B:2;", ";", "A=1;B=2;" },
        { "junk;A: 1,B: 2;", ";,", "A=1;B=2;" },
    };
    for (const auto& row : kCases)
        EXPECT_EQ(described(divide(row.input, row.separators).get()), row.entries) << row.input;
}

TEST(TheTextForm, RoundTripsADictionaryAsStringsButCutsAValueThatHoldsTheSeparator) {
    Dict dict{ Entry("Address", text("00:11:22:33:44:55")), Entry("Class", Variant(7936u)),
               Entry("RSSI", Variant(-60)), Entry("Paired", Variant(true)),
               Entry("UUIDs", Variant(std::vector<std::string>{ "110b", "110e" })),
               Entry("Vendor", Variant(static_cast<unsigned short>(29))), Entry("Name", text("")),
               Entry("Class", Variant(1u)) };
    std::string separator = ";", asStrings;
    for (const Entry& entry : dict) asStrings += entry.first + "=" + variantToString(entry.second) + ";";
    EXPECT_EQ(described(divide(dictConquerToString(dict, separator), separator).get()), asStrings);
    EXPECT_EQ(described(divide(dictToString(dict), "\n").get()), asStrings);

    // "b" is dropped; "D: e" becomes an entry of its own.
    Dict cut{ Entry("Name", text("a;b")), Entry("Alias", text("c;D: e")) };
    EXPECT_EQ(described(divide(dictConquerToString(cut, separator), separator).get()), "Name=a;Alias=c;D=e;");
}

}  // namespace
