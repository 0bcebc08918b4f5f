#include <bluetooth/remote_object.h>

#include <cstdio>
#include <tuple>
#include <utility>

#include "core/dbus_holders.h"
#include "core/decode.h"

namespace Bluetooth {

namespace internal {

namespace {

// Room for guess more elements in values, made at once: growing a vector from
// nothing element by element reallocates and moves it several times.
template <typename T>
void makeRoom(std::vector<T>& values, size_t guess) {
    if (values.capacity() - values.size() < guess) values.reserve(values.size() + guess);
}

// Most lists are short (libdbus counts an array's elements only by walking it).
const size_t kTextsGuess = 8;

// Reads an array of texts (signatures too, if asked) into values. The element
// type is checked before any element is read: reading a number as a text would
// crash.
bool readTexts(DBusMessageIter& array, std::vector<std::string>& values, bool signatures) {
    DBusMessageIter element;
    dbus_message_iter_recurse(&array, &element);
    int type = typeOf(element);
    if (type == DBUS_TYPE_INVALID) return true;
    if (type != DBUS_TYPE_STRING && type != DBUS_TYPE_OBJECT_PATH &&
        (type != DBUS_TYPE_SIGNATURE || !signatures))
        return false;
    makeRoom(values, kTextsGuess);
    do
        values.emplace_back(readText(element));
    while (dbus_message_iter_next(&element));
    return true;
}

// BlueZ's property replies hold 10 to 20 entries.
const size_t kEntriesGuess = 16;

// The text of an entry name of type: a string's own, or a number written into
// digits; null for another type. Names and values are decoded for types known
// already: every entry of a dictionary has the same types, asked for once.
typedef char Digits[16];
const char* nameOf(int type, DBusMessageIter& iterator, Digits& digits) {
    if (type == DBUS_TYPE_STRING) return readText(iterator);
    if (type != DBUS_TYPE_UINT32) return 0;
    dbus_uint32_t number = 0;
    dbus_message_iter_get_basic(&iterator, &number);
    std::snprintf(digits, sizeof digits, "%u", static_cast<unsigned>(number));
    return digits;
}

// Where a decoded value goes: into a variant that is there already, or into a
// new last entry of a dictionary, built in place with its name.
struct IntoVariant {
    VariantBase& held;
    template <typename T>
    void operator()(T&& value) const {
        held = std::forward<T>(value);
    }
};

struct IntoNewEntry {
    Dict& dict;
    const char* name;
    template <typename T>
    void operator()(T&& value) const {
        dict.emplace_back(std::piecewise_construct, std::forward_as_tuple(name),
                          std::forward_as_tuple(std::forward<T>(value)));
    }
};

template <typename Sink>
int decodeValueOf(int type, DBusMessageIter& iterator, const Sink& sink) {
    if (type == DBUS_TYPE_STRING) {
        sink(std::string(readText(iterator)));
        return 0;
    }
    if (type != DBUS_TYPE_VARIANT) return 4;
    DBusMessageIter inner;
    dbus_message_iter_recurse(&iterator, &inner);
    switch (typeOf(inner)) {
    case DBUS_TYPE_UINT32: {
        dbus_uint32_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        sink(static_cast<unsigned int>(number));
        return 0;
    }
    case DBUS_TYPE_UINT16: {
        dbus_uint16_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        sink(static_cast<unsigned short>(number));
        return 0;
    }
    case DBUS_TYPE_BOOLEAN: {
        dbus_bool_t truth = FALSE;
        dbus_message_iter_get_basic(&inner, &truth);
        sink(truth != 0);
        return 0;
    }
    case DBUS_TYPE_STRING:
    case DBUS_TYPE_OBJECT_PATH:
        sink(std::string(readText(inner)));
        return 0;
    case DBUS_TYPE_INT16: {
        dbus_int16_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        sink(static_cast<int>(number));
        return 0;
    }
    case DBUS_TYPE_ARRAY: {
        std::vector<std::string> texts;
        if (!readTexts(inner, texts, false)) return 4;
        sink(std::move(texts));  // moved, not copied
        return 0;
    }
    default:
        return 4;
    }
}

}  // namespace

int decodeName(DBusMessageIter& iterator, std::string& name) {
    Digits digits;
    const char* text = nameOf(typeOf(iterator), iterator, digits);
    if (text == 0) return 4;
    name = text;
    return 0;
}

int decodeValue(DBusMessageIter& iterator, Variant& value) {
    IntoVariant into = { value };
    return decodeValueOf(typeOf(iterator), iterator, into);
}

EntriesResult decodeEntries(DBusMessageIter& array, Dict& dict) {
    DBusMessageIter element;
    dbus_message_iter_recurse(&array, &element);
    if (typeOf(element) != DBUS_TYPE_DICT_ENTRY) return kEntriesDecoded;  // none
    makeRoom(dict, kEntriesGuess);
    int nameType = DBUS_TYPE_INVALID;
    int valueType = DBUS_TYPE_INVALID;
    do {
        DBusMessageIter field;
        dbus_message_iter_recurse(&element, &field);
        if (nameType == DBUS_TYPE_INVALID) nameType = typeOf(field);
        Digits digits;
        const char* name = nameOf(nameType, field, digits);
        if (name == 0) return kBadEntryName;
        if (*name == '\0') break;  // ends the dictionary quietly, on purpose
        dbus_message_iter_next(&field);
        if (valueType == DBUS_TYPE_INVALID) valueType = typeOf(field);
        IntoNewEntry into = { dict, name };
        if (decodeValueOf(valueType, field, into) != 0) return kBadEntryValue;
    } while (dbus_message_iter_next(&element));
    return kEntriesDecoded;
}

}  // namespace internal

using internal::MessagePtr;
using internal::readText;

using internal::typeOf;

namespace {
const int kBusError = 11;
}  // namespace

DBusMessage* RemoteObject::takeReply(DBusMessageIter& iterator) {
    DBusMessage* taken = reply;
    reply = 0;
    if (taken != 0)
        dbus_message_iter_init(taken, &iterator);
    else
        fail(2);
    return taken;
}

int RemoteObject::getReplyValue(std::string& value) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (typeOf(arguments) != DBUS_TYPE_STRING) return fail(4);
    value = readText(arguments);
    return 0;
}

int RemoteObject::getReplyValue(bool& value) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (typeOf(arguments) != DBUS_TYPE_BOOLEAN) return fail(4);
    dbus_bool_t truth = FALSE;
    dbus_message_iter_get_basic(&arguments, &truth);
    value = truth != 0;
    return 0;
}

int RemoteObject::getReplyValue(ObjectPath& value) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    int type = typeOf(arguments);
    if (type == DBUS_TYPE_OBJECT_PATH) {
        value = ObjectPath(readText(arguments));
        return 0;
    }
    // Unlike the other readers: error 11 with the text unchanged, and -2 with the
    // peer's text for a string, which is how an error reply arrives here.
    std::lock_guard<std::mutex> hold(errorLock);
    errorNumber = kBusError;
    if (type != DBUS_TYPE_STRING) return -1;
    value = ObjectPath(readText(arguments));
    errorMessage = value.str();
    const char* name = dbus_message_get_error_name(taken.get());
    errorName = name != 0 ? name : "";
    return -2;
}

int RemoteObject::readStringArray(std::vector<std::string>& values) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (typeOf(arguments) != DBUS_TYPE_ARRAY) return fail(4);
    values.clear();
    return internal::readTexts(arguments, values, true) ? 0 : fail(4);
}

int RemoteObject::getReplyValue(std::vector<std::string>& values) { return readStringArray(values); }

int RemoteObject::getReplyValue(std::vector<ObjectPath>& values) {
    std::vector<std::string> texts;
    int result = readStringArray(texts);
    if (result == 0) values.clear();
    values.reserve(values.size() + texts.size());
    for (size_t i = 0; i < texts.size(); ++i) values.push_back(ObjectPath(texts[i]));
    return result;
}

int RemoteObject::getReplyValue(Dict& dict) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (typeOf(arguments) != DBUS_TYPE_ARRAY ||
        dbus_message_iter_get_element_type(&arguments) != DBUS_TYPE_DICT_ENTRY)
        return fail(5);
    dict.clear();
    return internal::decodeEntries(arguments, dict) == internal::kEntriesDecoded ? 0 : fail(4);
}

int RemoteObject::parseEntryName(DBusMessageIter& iterator, Entry& entry) {
    int number = internal::decodeName(iterator, entry.first);
    return number == 0 ? 0 : fail(number);
}

int RemoteObject::parseEntryValue(DBusMessageIter& iterator, Entry& entry) {
    int number = internal::decodeValue(iterator, entry.second);
    return number == 0 ? 0 : fail(number);
}

}  // namespace Bluetooth
