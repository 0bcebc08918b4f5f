#ifndef BTBUS_SRC_CORE_DECODE_H
#define BTBUS_SRC_CORE_DECODE_H

#include <string>

#include <dbus/dbus.h>

#include <bluetooth/variant.h>

namespace Bluetooth {
namespace internal {

// Decoding of message arguments into the value model, shared by replies and
// signals. Each returns 0, or the error number its failure sets (4); none
// advances the iterator.

// The type of the iterator's current argument.
inline int typeOf(DBusMessageIter& iterator) { return dbus_message_iter_get_arg_type(&iterator); }

// The text of a STRING, OBJECT_PATH or SIGNATURE argument.
inline const char* readText(DBusMessageIter& iterator) {
    const char* text = "";
    dbus_message_iter_get_basic(&iterator, &text);
    return text;
}

// An entry name: a STRING as it stands, a UINT32 as its decimal text.
int decodeName(DBusMessageIter& iterator, std::string& name);
// An entry value: a STRING, or a VARIANT of u, q, b, s, o, n, or an array of
// strings or object paths.
int decodeValue(DBusMessageIter& iterator, Variant& value);

// Appends the entries of an array of dictionary entries to dict, up to an entry
// with an empty name; says which part of an entry failed.
enum EntriesResult { kEntriesDecoded, kBadEntryName, kBadEntryValue };
EntriesResult decodeEntries(DBusMessageIter& array, Dict& dict);

}  // namespace internal
}  // namespace Bluetooth

#endif
