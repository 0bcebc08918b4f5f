// The text form's parsers against a plain model of their rules, and the round
// trip of a dictionary made from the input.
#include <cctype>
#include <memory>

#include <bluetooth/util.h>

#include "fuzz.h"

using namespace Bluetooth;

namespace {

// Entries as names and texts.
typedef std::vector<std::pair<std::string, std::string> > Model;

std::string trimmed(const std::string& text) {
    size_t begin = 0, end = text.size();
    while (begin < end && isspace(static_cast<unsigned char>(text[begin]))) ++begin;
    while (end > begin && isspace(static_cast<unsigned char>(text[end - 1]))) --end;
    return text.substr(begin, end - begin);
}

// "name: value" split at the first colon, both trimmed, added to entries; nothing without a colon.
Model& modelEntry(const std::string& text, Model& entries) {
    size_t colon = text.find(':');
    if (colon < text.size()) entries.emplace_back(trimmed(text.substr(0, colon)), trimmed(text.substr(colon + 1)));
    return entries;
}

// Every piece closed by a separator character, as entries; text after the last one is not read.
Model modelDict(const std::string& text, const std::string& separators) {
    Model entries;
    for (size_t at = 0, end; (end = text.find_first_of(separators, at)) != std::string::npos; at = end + 1)
        modelEntry(text.substr(at, end - at), entries);
    return entries;
}

// A dictionary's entries as names and texts; none for null.
Model modelOf(const Dict* dict) {
    Model entries;
    for (size_t i = 0; dict != 0 && i < dict->size(); ++i)
        entries.push_back(std::make_pair((*dict)[i].first, variantToString((*dict)[i].second)));
    return entries;
}

// Whether a parser gave what the model gives: null exactly for nothing.
bool same(const Dict* dict, const Model& model) { return (dict == 0) == model.empty() && modelOf(dict) == model; }

// A value of each alternative in turn, made of the input's bytes.
Variant valueOf(const std::string& text, size_t i) {
    unsigned int n = 0;
    for (unsigned char c : text) n = n * 31 + c;
    const Variant values[] = { Variant(n), Variant(static_cast<unsigned short>(n)), Variant((n & 1) != 0),
                               Variant(text), Variant(std::vector<std::string>{ text, text }),
                               Variant(static_cast<int>(n)) };
    return values[i % 6];
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string text(reinterpret_cast<const char*>(data), size);
    std::unique_ptr<Entry> entry(stringToEntry(text));
    Dict read;
    if (entry) read.push_back(*entry);
    Model model;
    fuzz::require(same(entry ? &read : 0, modelEntry(text, model)) && (!entry || entry->second.which() == 3),
                  "an entry exactly when there is a colon, its name and string value trimmed");
    for (const char* separators : { ";", ";,", "\n", "" }) {
        std::unique_ptr<Dict> dict(stringDivideToDict(text, separators));
        fuzz::require(same(dict.get(), modelDict(text, separators)), "the dictionary the rules give");
    }
    // Pieces of the input, cleaned of what the text form cannot carry, go
    // there and back unchanged.
    Dict dict;
    for (size_t at = 0; at < text.size(); at += 7) {
        std::string clean;
        for (char c : text.substr(at, 7))
            if (c != ';' && c != ':' && c != ',' && c != '[' && c != ']' && c != '\0') clean += c;
        clean = trimmed(clean);
        if (!clean.empty()) dict.push_back(Entry(clean, valueOf(clean, dict.size())));
    }
    std::string separator = ";";
    std::unique_ptr<Dict> back(stringDivideToDict(dictConquerToString(dict, separator), separator));
    fuzz::require(same(back.get(), modelOf(&dict)), "the round trip");
    return 0;
}
