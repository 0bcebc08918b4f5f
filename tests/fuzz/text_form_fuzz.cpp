// The text form's parsers against a plain model of their rules, and the round
// trip of a dictionary made from the input.
#include <cctype>
#include <memory>

#include <bluetooth/util.h>

#include "fuzz.h"

using namespace Bluetooth;

namespace {

std::string trimmed(const std::string& text) {
    size_t begin = 0, end = text.size();
    while (begin < end && isspace(static_cast<unsigned char>(text[begin]))) ++begin;
    while (end > begin && isspace(static_cast<unsigned char>(text[end - 1]))) --end;
    return text.substr(begin, end - begin);
}

// "name: value" split at the first colon, both trimmed; false without one.
bool modelEntry(const std::string& text, std::string& name, std::string& value) {
    size_t colon = text.find(':');
    if (colon == std::string::npos) return false;
    name = trimmed(text.substr(0, colon));
    value = trimmed(text.substr(colon + 1));
    return true;
}

// Every piece closed by a separator character, as entries; text after the last one is not read.
std::vector<std::pair<std::string, std::string> > modelDict(const std::string& text, const std::string& separators) {
    std::vector<std::pair<std::string, std::string> > entries;
    for (size_t at = 0, end; (end = text.find_first_of(separators, at)) != std::string::npos; at = end + 1) {
        std::string name, value;
        if (modelEntry(trimmed(text.substr(at, end - at)), name, value)) entries.push_back(std::make_pair(name, value));
    }
    return entries;
}

bool same(const Dict* dict, const std::vector<std::pair<std::string, std::string> >& model) {
    if (dict == 0) return model.empty();
    if (dict->size() != model.size() || model.empty()) return false;
    for (size_t i = 0; i < model.size(); ++i)
        if ((*dict)[i].first != model[i].first || variantToString((*dict)[i].second) != model[i].second) return false;
    return true;
}

// A value of each alternative in turn, made of the input's bytes.
Variant valueOf(const std::string& text, size_t i) {
    unsigned int number = 0;
    for (unsigned char c : text) number = number * 31 + c;
    switch (i % 6) {
    case 0: return Variant(number);
    case 1: return Variant(static_cast<unsigned short>(number));
    case 2: return Variant((number & 1) != 0);
    case 3: return Variant(text);
    case 4: return Variant(std::vector<std::string>{ text, text });
    default: return Variant(static_cast<int>(number));
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string text(reinterpret_cast<const char*>(data), size);
    std::unique_ptr<Entry> entry(stringToEntry(text));
    std::string name, value;
    fuzz::require((entry != 0) == modelEntry(text, name, value), "an entry exactly when there is a colon");
    fuzz::require(!entry || (entry->first == name && entry->second.which() == 3 && variantToString(entry->second) == value),
                  "the entry's trimmed name and string value");
    for (const char* separators : { ";", ";,", "\n" }) {
        std::unique_ptr<Dict> dict(stringDivideToDict(text, separators));
        fuzz::require(same(dict.get(), modelDict(text, separators)), "the dictionary the rules give");
    }
    // Pieces of the input, cleaned of what the text form cannot carry, go
    // there and back unchanged.
    Dict dict;
    for (size_t at = 0; at < text.size(); at += 7) {
        std::string piece = text.substr(at, 7), clean;
        for (char c : piece)
            if (c != ';' && c != ':' && c != ',' && c != '[' && c != ']' && c != '\0') clean += c;
        clean = trimmed(clean);
        if (!clean.empty()) dict.push_back(Entry(clean, valueOf(clean, dict.size())));
    }
    std::string separator = ";";
    std::string written = dictConquerToString(dict, separator);
    std::unique_ptr<Dict> back(stringDivideToDict(written, separator));
    std::vector<std::pair<std::string, std::string> > expected;
    for (const Entry& e : dict) expected.push_back(std::make_pair(e.first, variantToString(e.second)));
    fuzz::require(same(back.get(), expected), "the round trip");
    return 0;
}
