#include <bluetooth/remote_object.h>

#include <cstdio>

#include "core/dbus_holders.h"
#include "core/decode.h"

namespace Bluetooth {

namespace internal {

namespace {

bool isText(int type) {
    return type == DBUS_TYPE_STRING || type == DBUS_TYPE_OBJECT_PATH || type == DBUS_TYPE_SIGNATURE;
}

// Reads an array of texts into values. The element type is checked before any
// element is read, because reading a number as a text would crash.
bool readTexts(DBusMessageIter& array, std::vector<std::string>& values) {
    DBusMessageIter element;
    dbus_message_iter_recurse(&array, &element);
    int type = typeOf(element);
    if (type == DBUS_TYPE_INVALID) return true;
    if (!isText(type)) return false;
    values.reserve(values.size() + static_cast<size_t>(dbus_message_iter_get_element_count(&array)));
    do
        values.push_back(readText(element));
    while (dbus_message_iter_next(&element));
    return true;
}

// Room made for a dictionary at once: BlueZ's property replies hold 10 to 20
// entries, and growing entry by entry moves every entry several times.
const size_t kEntriesGuess = 16;

}  // namespace

int decodeName(DBusMessageIter& iterator, std::string& name) {
    int type = typeOf(iterator);
    if (type == DBUS_TYPE_STRING) {
        name = readText(iterator);
        return 0;
    }
    if (type == DBUS_TYPE_UINT32) {
        dbus_uint32_t number = 0;
        dbus_message_iter_get_basic(&iterator, &number);
        char text[16];
        std::snprintf(text, sizeof text, "%u", static_cast<unsigned>(number));
        name = text;
        return 0;
    }
    return 4;
}

int decodeValue(DBusMessageIter& iterator, Variant& value) {
    int type = typeOf(iterator);
    VariantBase& held = value;  // assigned in place, without a temporary Variant
    if (type == DBUS_TYPE_STRING) {
        held = std::string(readText(iterator));
        return 0;
    }
    if (type != DBUS_TYPE_VARIANT) return 4;
    DBusMessageIter inner;
    dbus_message_iter_recurse(&iterator, &inner);
    switch (typeOf(inner)) {
    case DBUS_TYPE_UINT32: {
        dbus_uint32_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        held = static_cast<unsigned int>(number);
        return 0;
    }
    case DBUS_TYPE_UINT16: {
        dbus_uint16_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        held = static_cast<unsigned short>(number);
        return 0;
    }
    case DBUS_TYPE_BOOLEAN: {
        dbus_bool_t truth = FALSE;
        dbus_message_iter_get_basic(&inner, &truth);
        held = truth != 0;
        return 0;
    }
    case DBUS_TYPE_STRING:
    case DBUS_TYPE_OBJECT_PATH:
        held = std::string(readText(inner));
        return 0;
    case DBUS_TYPE_INT16: {
        dbus_int16_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        held = static_cast<int>(number);
        return 0;
    }
    case DBUS_TYPE_ARRAY: {
        DBusMessageIter element;
        dbus_message_iter_recurse(&inner, &element);
        int elementType = typeOf(element);
        if (elementType != DBUS_TYPE_INVALID && elementType != DBUS_TYPE_STRING &&
            elementType != DBUS_TYPE_OBJECT_PATH)
            return 4;
        // Filled in place: the list is not copied.
        held = std::vector<std::string>();
        readTexts(inner, boost::get<std::vector<std::string> >(held));
        return 0;
    }
    default:
        return 4;
    }
}

EntriesResult decodeEntries(DBusMessageIter& array, Dict& dict) {
    DBusMessageIter element;
    dbus_message_iter_recurse(&array, &element);
    if (dict.capacity() - dict.size() < kEntriesGuess) dict.reserve(dict.size() + kEntriesGuess);
    for (; typeOf(element) == DBUS_TYPE_DICT_ENTRY; dbus_message_iter_next(&element)) {
        DBusMessageIter field;
        dbus_message_iter_recurse(&element, &field);
        // Decoded in place, and taken back when it fails or ends the dictionary.
        dict.push_back(Entry());
        Entry& entry = dict.back();
        if (decodeName(field, entry.first) != 0) {
            dict.pop_back();
            return kBadEntryName;
        }
        if (entry.first.empty()) {  // ends the dictionary quietly, on purpose
            dict.pop_back();
            break;
        }
        dbus_message_iter_next(&field);
        if (decodeValue(field, entry.second) != 0) {
            dict.pop_back();
            return kBadEntryValue;
        }
    }
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
    return internal::readTexts(arguments, values) ? 0 : fail(4);
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
