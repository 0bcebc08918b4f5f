#ifndef BTBUS_BLUETOOTH_UTIL_H
#define BTBUS_BLUETOOTH_UTIL_H

#include <string>
#include <vector>

#include <bluetooth/variant.h>

namespace Bluetooth {

// The text form of values and property dictionaries. Writing is lossy: values
// are written bare, and reading gives every value back as a string.

// "[a, b]"; "[]" for an empty list. Elements are not escaped.
std::string stringArrayToString(const std::vector<std::string>& values);
// The held boolean; false for every other alternative.
bool variantToBool(const Variant& value);
// Decimal numbers, "1"/"0" for booleans, strings as they are, lists as above.
std::string variantToString(const Variant& value);
// "name: value\n" per entry, in order; "" for an empty dictionary.
std::string dictToString(const Dict& dict);
// Like dictToString, with separator written after every entry instead of "\n".
// The separator is only read.
std::string dictConquerToString(const Dict& dict, std::string& separator);
// Text form of the first entry named exactly name; "" when there is none or
// when dict or name is null.
std::string find(const Dict* dict, const char* name);
// Parses "name: value" (split at the first colon, both sides trimmed) into a
// new Entry holding the value as a string; null when text holds no colon.
Entry* stringToEntry(const std::string& text);
// Parses entries each closed by one of the characters in separators; text after
// the last separator is ignored and pieces without a colon are skipped. A new
// Dict, or null when text holds no separator or no piece made an entry.
Dict* stringDivideToDict(const std::string& text, const std::string& separators);

}  // namespace Bluetooth

#endif
