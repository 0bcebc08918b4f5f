#include <bluetooth/remote_object.h>

#include <cerrno>
#include <iostream>

#include <bluetooth/connection.h>

#include "core/connection_loop.h"
#include "core/dbus_holders.h"
#include "core/log.h"

namespace Bluetooth {

namespace {

using internal::ScopedError;

const char* const kErrorTexts[] = {
    "",
    "Parameter is null",
    "Reply message is null",
    "Invalid path",
    "Invalid reply value",
    "Invalid reply format",
    "Failed to create message",
    "Failed to append args to message",
    "Failed to append args = iterator",
    "Failed to open container",
    "Failed to send message",
};
const int kTextErrors = sizeof kErrorTexts / sizeof kErrorTexts[0];
const int kBusError = 11;

const char* orEmpty(const char* text) { return text ? text : ""; }

}  // namespace

// ---- construction and access ----

RemoteObject::RemoteObject(const char* destination, const char* path, const char* interface,
                           DBusBusType busType)
    : destination(orEmpty(destination)),
      path(orEmpty(path)),
      interface(orEmpty(interface)),
      connection(0),
      message(0),
      reply(0),
      busType(busType),
      thread(),
      errorNumber(0),
      errorMessage(),
      errorName(),
      operationDepth(0),
      handlersReleased(false) {
    connection = Connection::get(busType);
    // The loop's filter sees every dispatch from now on, also those of a loop
    // of the program's own, so that a wait never takes a dispatch lock that
    // its thread holds.
    if (connection != 0) internal::ConnectionLoop::of(connection);
}

RemoteObject::~RemoteObject() {
    releaseHandlers();
    // A receiving thread started here goes on without this object.
    if (!pthread_equal(thread, pthread_t())) pthread_detach(thread);
    releaseReply();
    releaseMessage();
    if (connection != 0) Connection::unref(connection);
}

DBusConnection* RemoteObject::getConnection() const { return connection; }

const char* RemoteObject::getConnectionName() const {
    if (connection == 0) return "";
    return orEmpty(dbus_bus_get_unique_name(connection));
}

const char* RemoteObject::getDestination() const { return destination.c_str(); }
const char* RemoteObject::getPath() const { return path.c_str(); }
const char* RemoteObject::getInterface() const { return interface.c_str(); }

std::string RemoteObject::getInfo() const {
    return "RemoteObject name: " + destination + "\nPath: " + path + "\nInterface: " + interface +
           "\n";
}

int RemoteObject::printInfo() const {
    std::cout << getInfo();
    return 0;
}

// ---- error state ----

int RemoteObject::fail(int number, const char* text, const char* name) {
    std::lock_guard<std::mutex> hold(errorLock);
    errorNumber = number;
    if (text != 0) errorMessage = text;
    errorName = name != 0 ? name : "";
    return -1;
}

void RemoteObject::resetError() {
    std::lock_guard<std::mutex> hold(errorLock);
    errorNumber = 0;
    errorMessage.clear();
    errorName.clear();
}

bool RemoteObject::hasError() const {
    std::lock_guard<std::mutex> hold(errorLock);
    return errorNumber != 0;
}

int RemoteObject::getErrorNumber() const {
    std::lock_guard<std::mutex> hold(errorLock);
    return errorNumber;
}

std::string RemoteObject::getErrorName() const {
    std::lock_guard<std::mutex> hold(errorLock);
    return errorNumber == kBusError ? errorName : std::string();
}

std::string RemoteObject::getErrorMessage() {
    std::lock_guard<std::mutex> hold(errorLock);
    if (errorNumber == 0 || errorNumber == kBusError) return errorMessage;
    if (errorNumber > 0 && errorNumber < kTextErrors)
        errorMessage = kErrorTexts[errorNumber];
    else
        errorMessage = "Unknown error";
    return errorMessage;
}

// ---- building a call ----

int RemoteObject::newMessage(const char* method) {
    if (method == 0) return fail(1);
    releaseMessage();
    // libdbus aborts the process on names it considers invalid, so they are
    // checked here and reported like any other failure to create the call.
    // The object's own names, checked once per thread until they change.
    thread_local std::string validDestination, validPath, validInterface;
    if (destination != validDestination || path != validPath || interface != validInterface) {
        if (!dbus_validate_bus_name(destination.c_str(), 0) || !dbus_validate_path(path.c_str(), 0) ||
            !dbus_validate_interface(interface.c_str(), 0))
            return fail(6);
        validDestination = destination;
        validPath = path;
        validInterface = interface;
    }
    if (!dbus_validate_member(method, 0)) return fail(6);
    message = dbus_message_new_method_call(destination.c_str(), path.c_str(), interface.c_str(),
                                           method);
    return message != 0 ? 0 : fail(6);
}

int RemoteObject::append(bool value) {
    dbus_bool_t truth = value ? TRUE : FALSE;
    if (message == 0 || !dbus_message_append_args(message, DBUS_TYPE_BOOLEAN, &truth, DBUS_TYPE_INVALID))
        return fail(7);
    return 0;
}

int RemoteObject::append(const char* value) {
    if (value == 0) return fail(1);
    if (message == 0 || !dbus_validate_utf8(value, 0) ||
        !dbus_message_append_args(message, DBUS_TYPE_STRING, &value, DBUS_TYPE_INVALID))
        return fail(7);
    return 0;
}

int RemoteObject::append(const ObjectPath& objectPath) {
    const char* text = objectPath.c_str();
    if (text[0] != '/') return fail(3);
    if (message == 0 || !dbus_validate_path(text, 0) ||
        !dbus_message_append_args(message, DBUS_TYPE_OBJECT_PATH, &text, DBUS_TYPE_INVALID))
        return fail(7);
    return 0;
}

int RemoteObject::append(unsigned int value) {
    dbus_uint32_t number = value;
    if (message == 0 || !dbus_message_append_args(message, DBUS_TYPE_UINT32, &number, DBUS_TYPE_INVALID))
        return fail(7);
    return 0;
}

int RemoteObject::append(unsigned short value) {
    dbus_uint16_t number = value;
    if (message == 0 || !dbus_message_append_args(message, DBUS_TYPE_UINT16, &number, DBUS_TYPE_INVALID))
        return fail(7);
    return 0;
}

int RemoteObject::append(const Variant& value) {
    static const char* const kSignatures[] = { "u", "q", "b", "s" };
    // Lists and signed numbers have no signature to write; libdbus would abort
    // on an empty one, so no container is opened for them.
    if (value.which() > 3 || message == 0) return fail(9);
    DBusMessageIter arguments;
    dbus_message_iter_init_append(message, &arguments);
    internal::OpenContainer variant(arguments, DBUS_TYPE_VARIANT, kSignatures[value.which()]);
    if (!variant.isOpen()) return fail(9);
    bool appended = false;
    switch (value.which()) {
    case 0: {
        dbus_uint32_t number = boost::get<unsigned int>(value);
        appended = dbus_message_iter_append_basic(variant.iterator(), DBUS_TYPE_UINT32, &number);
        break;
    }
    case 1: {
        dbus_uint16_t number = boost::get<unsigned short>(value);
        appended = dbus_message_iter_append_basic(variant.iterator(), DBUS_TYPE_UINT16, &number);
        break;
    }
    case 2: {
        dbus_bool_t truth = boost::get<bool>(value) ? TRUE : FALSE;
        appended = dbus_message_iter_append_basic(variant.iterator(), DBUS_TYPE_BOOLEAN, &truth);
        break;
    }
    default: {
        const char* text = boost::get<std::string>(value).c_str();
        appended = dbus_validate_utf8(text, 0) &&
                   dbus_message_iter_append_basic(variant.iterator(), DBUS_TYPE_STRING, &text);
        break;
    }
    }
    if (!appended) return fail(8);  // the holder abandons the container
    return variant.close() ? 0 : fail(9);
}

void RemoteObject::releaseMessage() {
    if (message != 0) dbus_message_unref(message);
    message = 0;
}

void RemoteObject::releaseReply() {
    if (reply != 0) dbus_message_unref(reply);
    reply = 0;
}

// ---- sending ----

const char* RemoteObject::cannotSend() const {
    if (connection == 0) return "No connection to the bus";
    return message == 0 ? "No message to send" : 0;
}

int RemoteObject::sendMessage(bool waitReply, int timeout) {
    releaseReply();
    ScopedError error;
    int result = 0;
    if (const char* why = cannotSend()) {
        result = waitReply ? fail(kBusError, why) : fail(10);
    } else if (waitReply) {
        // libdbus aborts on a time-out below -1; those mean its default as well.
        if (timeout < -1) timeout = -1;
        reply = internal::ConnectionLoop::of(connection)->call(message, timeout, error.get());
        if (reply == 0) result = fail(kBusError, error.text(), error.name());
    } else {
        dbus_message_set_no_reply(message, TRUE);
        // A closed connection would accept the message and drop it silently.
        if (!dbus_connection_get_is_connected(connection) ||
            !dbus_connection_send(connection, message, 0))
            result = fail(10);
        else
            dbus_connection_flush(connection);
    }
    releaseMessage();
    return result;
}

int RemoteObject::setReplyMessage(DBusMessage* newReply) {
    if (newReply == 0) return fail(2);
    releaseReply();
    reply = newReply;
    return 0;
}

// ---- receiving thread ----

int RemoteObject::startLoop() {
    if (connection == 0) return pthread_create(&thread, 0, &receiveSignal, this);
    // Announced before the thread runs, so that calls made right after this
    // already leave the connection's socket to it.
    internal::ConnectionLoop* loop = internal::ConnectionLoop::of(connection);
    loop->addReceiver(this);
    int result = pthread_create(&thread, 0, &receiveSignal, this);
    if (result != 0) loop->removeReceiver(this);
    return result;
}

void RemoteObject::stopLoop() { internal::ConnectionLoop::stopAll(); }

int RemoteObject::waitLoop() {
    if (pthread_equal(thread, pthread_t())) return ESRCH;  // never started, or joined already
    int result = pthread_join(thread, 0);
    thread = pthread_t();
    return result;
}

}  // namespace Bluetooth
