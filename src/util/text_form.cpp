#include <bluetooth/util.h>

#include <cctype>
#include <sstream>

namespace Bluetooth {

namespace {

std::string trim(const std::string& text) {
    std::string::size_type begin = 0;
    std::string::size_type end = text.size();
    while (begin < end && std::isspace(static_cast<unsigned char>(text[begin]))) ++begin;
    while (end > begin && std::isspace(static_cast<unsigned char>(text[end - 1]))) --end;
    return text.substr(begin, end - begin);
}

class ValueText : public boost::static_visitor<std::string> {
public:
    std::string operator()(unsigned int value) const { return number(value); }
    std::string operator()(unsigned short value) const { return number(value); }
    std::string operator()(bool value) const { return value ? "1" : "0"; }
    std::string operator()(const std::string& value) const { return value; }
    std::string operator()(const std::vector<std::string>& value) const {
        return stringArrayToString(value);
    }
    std::string operator()(int value) const { return number(value); }

private:
    template <typename T>
    static std::string number(T value) {
        std::ostringstream text;
        text << value;
        return text.str();
    }
};

std::string joinEntries(const Dict& dict, const std::string& separator) {
    std::string text;
    for (Dict::const_iterator it = dict.begin(); it != dict.end(); ++it)
        text += it->first + ": " + variantToString(it->second) + separator;
    return text;
}

}  // namespace

std::string stringArrayToString(const std::vector<std::string>& values) {
    std::string text = "[";
    for (size_t i = 0; i < values.size(); ++i) {
        if (i != 0) text += ", ";
        text += values[i];
    }
    return text + "]";
}

bool variantToBool(const Variant& value) {
    const bool* truth = boost::get<bool>(&value);
    return truth != 0 && *truth;
}

std::string variantToString(const Variant& value) {
    return boost::apply_visitor(ValueText(), value);
}

std::string dictToString(const Dict& dict) { return joinEntries(dict, "\n"); }

std::string dictConquerToString(const Dict& dict, std::string& separator) {
    return joinEntries(dict, separator);
}

std::string find(const Dict* dict, const char* name) {
    if (dict == 0 || name == 0) return "";
    for (Dict::const_iterator it = dict->begin(); it != dict->end(); ++it)
        if (it->first == name) return variantToString(it->second);
    return "";
}

Entry* stringToEntry(const std::string& text) {
    std::string::size_type colon = text.find(':');
    if (colon == std::string::npos) return 0;
    return new Entry(trim(text.substr(0, colon)), Variant(trim(text.substr(colon + 1))));
}

Dict* stringDivideToDict(const std::string& text, const std::string& separators) {
    Dict* dict = 0;
    std::string::size_type start = 0;
    std::string::size_type end;
    // The text after the last separator is never read: every entry is closed.
    while ((end = text.find_first_of(separators, start)) != std::string::npos) {
        Entry* entry = stringToEntry(trim(text.substr(start, end - start)));
        if (entry != 0) {
            if (dict == 0) dict = new Dict;
            dict->push_back(*entry);
            delete entry;
        }
        start = end + 1;
    }
    return dict;
}

}  // namespace Bluetooth
