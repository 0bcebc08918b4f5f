#include <bluetooth/remote_object.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <chrono>
#include <condition_variable>
#include <iostream>
#include <mutex>
#include <sstream>

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <bluetooth/connection.h>

#include "core/dbus_holders.h"
#include "core/log.h"
#include "core/loop_flags.h"

BT_LOG_FILE("remote_object.cpp");

namespace Bluetooth {

std::list<SignalHandler<SignalFunctionNoArgument> > RemoteObject::signalHandlerVectorNoArgument;
std::list<SignalHandler<SignalFunctionString> > RemoteObject::signalHandlerVectorString;
std::list<SignalHandler<SignalFunctionObjectPath> > RemoteObject::signalHandlerVectorObjectPath;
std::list<SignalHandler<SignalFunctionStringVariant> >
    RemoteObject::signalHandlerVectorStringVariant;
std::list<SignalHandler<SignalFunctionStringDict> > RemoteObject::signalHandlerVectorStringDict;

namespace {

using internal::MessagePtr;
using internal::ScopedError;

// Written by signal handlers and other threads, read by waiting loops.
enum { kInterrupted, kReplyArrived, kStop };
volatile sig_atomic_t gFlags[3] = { 0, 0, 0 };

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

// ---- receiving loop state, one per connection on which a loop was started ----

struct LoopState {
    DBusConnection* connection;
    // The object whose loop last started here: the dispatching object for
    // signals dispatched by a thread that is not a receiving thread (a thread
    // waiting in sendMessagePending, say).
    std::atomic<RemoteObject*> owner;
    int wake[2];  // written when messages are queued or the loops must stop
    std::atomic<int> running;  // receiving threads serving this connection
};

std::mutex gLoopsLock;
std::vector<LoopState*> gLoops;  // never freed: shared connections live as long

// The receiving thread's own object; null on other threads.
thread_local RemoteObject* tDispatching = 0;

void wake(LoopState* state) {
    char byte = 1;
    ssize_t written = write(state->wake[1], &byte, 1);
    (void)written;  // a full pipe already wakes the loop
}

void drain(int fd) {
    char buffer[64];
    while (read(fd, buffer, sizeof buffer) > 0) {
    }
}

// Messages can be queued by another thread's I/O (a blocking call reads the
// signals that arrive with its reply); this wakes the loop for them.
void onDispatchStatus(DBusConnection*, DBusDispatchStatus status, void* data) {
    if (status == DBUS_DISPATCH_DATA_REMAINS) wake(static_cast<LoopState*>(data));
}

void offerSignal(RemoteObject* object, DBusMessage* message) {
    RemoteObject::signalHandlerDispatcherObjectPath(object, message);
    RemoteObject::signalHandlerDispatcherStringVariant(object, message);
    RemoteObject::signalHandlerDispatcherString(object, message);
    RemoteObject::signalHandlerDispatcherStringDict(object, message);
    RemoteObject::signalHandlerDispatcherNoArgument(object, message);
}

// Every message is left unhandled so that other filters, pending calls and
// registered object paths still see it.
DBusHandlerResult signalFilter(DBusConnection*, DBusMessage* message, void* data) {
    if (dbus_message_get_type(message) != DBUS_MESSAGE_TYPE_SIGNAL)
        return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
    RemoteObject* object = tDispatching;
    if (object == 0) object = static_cast<LoopState*>(data)->owner.load();
    if (object != 0) offerSignal(object, message);
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

LoopState* findLoop(DBusConnection* connection) {
    for (size_t i = 0; i < gLoops.size(); ++i)
        if (gLoops[i]->connection == connection) return gLoops[i];
    return 0;
}

LoopState* prepareLoop(DBusConnection* connection, RemoteObject* owner) {
    std::lock_guard<std::mutex> lock(gLoopsLock);
    LoopState* state = findLoop(connection);
    if (state == 0) {
        state = new LoopState;
        state->connection = connection;
        state->running = 0;
        if (pipe2(state->wake, O_NONBLOCK | O_CLOEXEC) != 0) {
            BT_LOG_ERR("Failed to create wake-up pipe (%d)", errno);
            state->wake[0] = state->wake[1] = -1;
        }
        // libdbus would otherwise _exit() the process when the bus goes away
        // while this loop dispatches.
        dbus_connection_set_exit_on_disconnect(connection, FALSE);
        dbus_connection_add_filter(connection, &signalFilter, state, 0);
        if (state->wake[1] >= 0)
            dbus_connection_set_dispatch_status_function(connection, &onDispatchStatus, state, 0);
        gLoops.push_back(state);
    }
    state->owner.store(owner);
    return state;
}

void forgetLoopOwner(RemoteObject* object) {
    std::lock_guard<std::mutex> lock(gLoopsLock);
    for (size_t i = 0; i < gLoops.size(); ++i) {
        RemoteObject* expected = object;
        gLoops[i]->owner.compare_exchange_strong(expected, 0);
    }
}

void wakeAllLoops() {
    std::lock_guard<std::mutex> lock(gLoopsLock);
    for (size_t i = 0; i < gLoops.size(); ++i)
        if (gLoops[i]->wake[1] >= 0) wake(gLoops[i]);
}

// Waits outside libdbus, so that other threads' blocking calls keep the I/O
// path. Returns true when the socket became readable.
bool waitReadable(DBusConnection* connection, LoopState* state, int milliseconds, bool socket) {
    struct pollfd fds[2];
    int count = 0;
    int fd = -1;
    if (state != 0 && state->wake[0] >= 0) {
        fds[count].fd = state->wake[0];
        fds[count].events = POLLIN;
        fds[count].revents = 0;
        ++count;
    }
    if (socket && dbus_connection_get_unix_fd(connection, &fd)) {
        fds[count].fd = fd;
        fds[count].events = POLLIN;
        fds[count].revents = 0;
        ++count;
    }
    if (count == 0) {
        usleep(milliseconds * 1000);
        return false;
    }
    if (poll(fds, count, milliseconds) <= 0) return false;
    if (state != 0 && state->wake[0] >= 0 && fds[0].revents != 0) drain(state->wake[0]);
    return fd >= 0 && fds[count - 1].revents != 0;
}

// ---- blocking calls beside a receiving thread ----

// libdbus's own default, used for a time-out of -1.
const int kDefaultTimeoutMs = 25000;
// How long queued messages may wait for a busy dispatcher before a waiting
// call looks for its reply itself.
const int kDispatchStallMs = 50;

// Counts the dispatches this library has finished, on any thread: a waiting
// call sees from it whether dispatching is making progress.
std::atomic<unsigned long> gDispatches(0);

struct Waiter {
    std::mutex lock;
    std::condition_variable done;
    bool completed;
};

void onCompleted(DBusPendingCall*, void* data) {
    Waiter* waiter = static_cast<Waiter*>(data);
    std::lock_guard<std::mutex> hold(waiter->lock);
    waiter->completed = true;
    waiter->done.notify_all();
}

void freeWaiter(void* data) { delete static_cast<Waiter*>(data); }

// The loop that serves connection, unless this thread is that loop.
LoopState* servingLoop(DBusConnection* connection) {
    if (tDispatching != 0) return 0;
    std::lock_guard<std::mutex> lock(gLoopsLock);
    LoopState* state = findLoop(connection);
    return state != 0 && state->running > 0 ? state : 0;
}

// A blocking call that leaves the connection's I/O to the receiving thread. A
// thread blocked in libdbus holds the I/O path: the answers that handlers on
// the receiving thread send (the agent's, say) would wait for it, and a call
// whose reply depends on them would stall until its time-out.
DBusMessage* callThroughLoop(LoopState* loop, DBusConnection* connection, DBusMessage* message,
                             int timeout, DBusError* error) {
    DBusPendingCall* pending = 0;
    if (!dbus_connection_send_with_reply(connection, message, &pending, timeout) || pending == 0) {
        dbus_set_error_const(error, DBUS_ERROR_DISCONNECTED, "Connection is closed");
        return 0;
    }
    Waiter* waiter = new Waiter;
    waiter->completed = false;
    dbus_pending_call_set_notify(pending, &onCompleted, waiter, &freeWaiter);
    dbus_connection_flush(connection);
    std::chrono::steady_clock::time_point deadline =
        std::chrono::steady_clock::now() +
        std::chrono::milliseconds(timeout < 0 ? kDefaultTimeoutMs : timeout);
    unsigned long seen = gDispatches;
    std::chrono::steady_clock::time_point progress = std::chrono::steady_clock::now();
    while (!dbus_pending_call_get_completed(pending)) {
        std::chrono::steady_clock::time_point now = std::chrono::steady_clock::now();
        if (gDispatches != seen) {
            seen = gDispatches;
            progress = now;
        }
        // Nobody dispatches any more, or a handler keeps the dispatcher busy
        // (the agent's delay, say) while the reply may be queued behind it:
        // libdbus's own wait finds a queued reply without dispatching.
        bool stalled = now - progress > std::chrono::milliseconds(kDispatchStallMs) &&
                       dbus_connection_get_dispatch_status(connection) == DBUS_DISPATCH_DATA_REMAINS;
        if (loop->running == 0 || stalled) {
            dbus_pending_call_block(pending);
            break;
        }
        if (now >= deadline) break;
        std::unique_lock<std::mutex> hold(waiter->lock);
        waiter->done.wait_for(hold, std::chrono::milliseconds(10), [waiter] { return waiter->completed; });
    }
    DBusMessage* reply = 0;
    if (dbus_pending_call_get_completed(pending)) {
        reply = dbus_pending_call_steal_reply(pending);
    } else {
        dbus_pending_call_cancel(pending);
        dbus_set_error_const(error, DBUS_ERROR_NO_REPLY,
                             "Did not receive a reply: the time-out expired before the peer answered");
    }
    dbus_pending_call_unref(pending);
    if (reply != 0 && dbus_set_error_from_message(error, reply)) {
        dbus_message_unref(reply);
        reply = 0;
    }
    return reply;
}

// ---- pending calls ----

void onInterrupt(int) { gFlags[kInterrupted] = 1; }

void installInterruptHandlers() {
    struct sigaction action;
    action.sa_handler = &onInterrupt;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_NOCLDSTOP;
    sigaction(SIGTERM, &action, 0);
    sigaction(SIGINT, &action, 0);
}

// ---- reading replies ----

int basicTypeOf(DBusMessageIter& iterator) { return dbus_message_iter_get_arg_type(&iterator); }

bool isText(int type) {
    return type == DBUS_TYPE_STRING || type == DBUS_TYPE_OBJECT_PATH || type == DBUS_TYPE_SIGNATURE;
}

const char* readText(DBusMessageIter& iterator) {
    const char* text = "";
    dbus_message_iter_get_basic(&iterator, &text);
    return text;
}

// Reads an array of texts. The element type is checked before any element is
// read, because reading a number as a text would crash.
bool readTexts(DBusMessageIter& array, std::vector<std::string>& values) {
    DBusMessageIter element;
    dbus_message_iter_recurse(&array, &element);
    int type = basicTypeOf(element);
    if (type != DBUS_TYPE_INVALID && !isText(type)) return false;
    for (; basicTypeOf(element) != DBUS_TYPE_INVALID; dbus_message_iter_next(&element))
        values.push_back(readText(element));
    return true;
}

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
      errorMessage() {
    connection = Connection::get(busType);
}

RemoteObject::~RemoteObject() {
    removeSignalHandlers(signalHandlerVectorNoArgument);
    removeSignalHandlers(signalHandlerVectorString);
    removeSignalHandlers(signalHandlerVectorObjectPath);
    removeSignalHandlers(signalHandlerVectorStringVariant);
    removeSignalHandlers(signalHandlerVectorStringDict);
    forgetLoopOwner(this);
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

int RemoteObject::fail(int number, const char* text) {
    errorNumber = number;
    if (text != 0) errorMessage = text;
    return -1;
}

void RemoteObject::resetError() {
    errorNumber = 0;
    errorMessage.clear();
}

bool RemoteObject::hasError() const { return errorNumber != 0; }

int RemoteObject::getErrorNumber() const { return errorNumber; }

std::string RemoteObject::getErrorMessage() {
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
    if (!dbus_validate_bus_name(destination.c_str(), 0) || !dbus_validate_path(path.c_str(), 0) ||
        !dbus_validate_interface(interface.c_str(), 0) || !dbus_validate_member(method, 0))
        return fail(6);
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

int RemoteObject::sendMessage(bool waitReply, int timeout) {
    releaseReply();
    ScopedError error;
    int result = 0;
    if (const char* why = cannotSend()) {
        result = waitReply ? fail(kBusError, why) : fail(10);
    } else if (waitReply) {
        // libdbus aborts on a time-out below -1; those mean its default as well.
        if (timeout < -1) timeout = -1;
        LoopState* loop = servingLoop(connection);
        if (loop != 0)
            reply = callThroughLoop(loop, connection, message, timeout, error.get());
        else
            reply = dbus_connection_send_with_reply_and_block(connection, message, timeout, error.get());
        if (reply == 0) result = fail(kBusError, error.text());
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

namespace {

// Runs on whichever thread dispatches the reply; the waiting thread takes it.
void onPendingReply(DBusPendingCall*, void*) { gFlags[kReplyArrived] = 1; }

}  // namespace

const char* RemoteObject::cannotSend() const {
    if (connection == 0) return "No connection to the bus";
    return message == 0 ? "No message to send" : 0;
}

int RemoteObject::sendMessagePending() {
    ScopedError error;
    releaseReply();
    int result = 0;
    DBusPendingCall* pending = 0;
    if (const char* why = cannotSend()) {
        result = fail(kBusError, why);
    } else if (!dbus_connection_send_with_reply(connection, message, &pending, -1)) {
        result = fail(kBusError, error.text());  // libdbus sets no error text here
    } else {
        if (pending != 0) dbus_pending_call_set_notify(pending, &onPendingReply, 0, 0);
        dbus_connection_flush(connection);
        installInterruptHandlers();
        // The call itself is asked too: another thread may have dispatched the
        // reply before the notify was set.
        while (!gFlags[kInterrupted] && !(pending != 0 && dbus_pending_call_get_completed(pending))) {
            bool open = dbus_connection_read_write_dispatch(connection, 500);
            ++gDispatches;
            if (!open) break;
        }
        if (pending != 0) {
            if (dbus_pending_call_get_completed(pending))
                setReplyMessage(dbus_pending_call_steal_reply(pending));  // none gives error 2
            else
                dbus_pending_call_cancel(pending);  // no reply can arrive for it later
            dbus_pending_call_unref(pending);
        }
    }
    releaseMessage();
    gFlags[kInterrupted] = 0;
    gFlags[kReplyArrived] = 0;
    return result;
}

// ---- reading replies ----

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
    if (basicTypeOf(arguments) != DBUS_TYPE_STRING) return fail(4);
    value = readText(arguments);
    return 0;
}

int RemoteObject::getReplyValue(bool& value) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (basicTypeOf(arguments) != DBUS_TYPE_BOOLEAN) return fail(4);
    dbus_bool_t truth = FALSE;
    dbus_message_iter_get_basic(&arguments, &truth);
    value = truth != 0;
    return 0;
}

int RemoteObject::getReplyValue(ObjectPath& value) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    int type = basicTypeOf(arguments);
    if (type == DBUS_TYPE_OBJECT_PATH) {
        value = ObjectPath(readText(arguments));
        return 0;
    }
    // Unlike the other readers: error 11 with the text unchanged, and -2 with the
    // peer's text for a string, which is how an error reply arrives here.
    errorNumber = kBusError;
    if (type != DBUS_TYPE_STRING) return -1;
    value = ObjectPath(readText(arguments));
    errorMessage = value.str();
    return -2;
}

int RemoteObject::readStringArray(std::vector<std::string>& values) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (basicTypeOf(arguments) != DBUS_TYPE_ARRAY) return fail(4);
    values.clear();
    return readTexts(arguments, values) ? 0 : fail(4);
}

int RemoteObject::getReplyValue(std::vector<std::string>& values) { return readStringArray(values); }

int RemoteObject::getReplyValue(std::vector<ObjectPath>& values) {
    std::vector<std::string> texts;
    int result = readStringArray(texts);
    if (result == 0) values.clear();
    for (size_t i = 0; i < texts.size(); ++i) values.push_back(ObjectPath(texts[i]));
    return result;
}

int RemoteObject::getReplyValue(Dict& dict) {
    DBusMessageIter arguments;
    MessagePtr taken(takeReply(arguments));
    if (!taken) return -1;
    if (basicTypeOf(arguments) != DBUS_TYPE_ARRAY ||
        dbus_message_iter_get_element_type(&arguments) != DBUS_TYPE_DICT_ENTRY)
        return fail(5);
    dict.clear();
    return decodeEntries(arguments, dict) == kEntriesDecoded ? 0 : -1;
}

int RemoteObject::decodeEntries(DBusMessageIter& array, Dict& dict) {
    DBusMessageIter element;
    dbus_message_iter_recurse(&array, &element);
    for (; basicTypeOf(element) == DBUS_TYPE_DICT_ENTRY; dbus_message_iter_next(&element)) {
        DBusMessageIter field;
        dbus_message_iter_recurse(&element, &field);
        Entry entry;
        if (parseEntryName(field, entry) != 0) return kBadEntryName;
        if (entry.first.empty()) break;  // ends the dictionary quietly, on purpose
        dbus_message_iter_next(&field);
        if (parseEntryValue(field, entry) != 0) return kBadEntryValue;
        dict.push_back(entry);
    }
    return kEntriesDecoded;
}

int RemoteObject::parseEntryName(DBusMessageIter& iterator, Entry& entry) {
    int type = basicTypeOf(iterator);
    if (type == DBUS_TYPE_STRING) {
        entry.first = readText(iterator);
        return 0;
    }
    if (type == DBUS_TYPE_UINT32) {
        dbus_uint32_t number = 0;
        dbus_message_iter_get_basic(&iterator, &number);
        std::ostringstream text;
        text << number;
        entry.first = text.str();
        return 0;
    }
    return fail(4);
}

int RemoteObject::parseEntryValue(DBusMessageIter& iterator, Entry& entry) {
    int type = basicTypeOf(iterator);
    if (type == DBUS_TYPE_STRING) {
        entry.second = std::string(readText(iterator));
        return 0;
    }
    if (type != DBUS_TYPE_VARIANT) return fail(4);
    DBusMessageIter inner;
    dbus_message_iter_recurse(&iterator, &inner);
    switch (basicTypeOf(inner)) {
    case DBUS_TYPE_UINT32: {
        dbus_uint32_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        entry.second = static_cast<unsigned int>(number);
        return 0;
    }
    case DBUS_TYPE_UINT16: {
        dbus_uint16_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        entry.second = static_cast<unsigned short>(number);
        return 0;
    }
    case DBUS_TYPE_BOOLEAN: {
        dbus_bool_t truth = FALSE;
        dbus_message_iter_get_basic(&inner, &truth);
        entry.second = truth != 0;
        return 0;
    }
    case DBUS_TYPE_STRING:
    case DBUS_TYPE_OBJECT_PATH:
        entry.second = std::string(readText(inner));
        return 0;
    case DBUS_TYPE_INT16: {
        dbus_int16_t number = 0;
        dbus_message_iter_get_basic(&inner, &number);
        entry.second = static_cast<int>(number);
        return 0;
    }
    case DBUS_TYPE_ARRAY: {
        std::vector<std::string> texts;
        DBusMessageIter element;
        dbus_message_iter_recurse(&inner, &element);
        int elementType = basicTypeOf(element);
        if (elementType != DBUS_TYPE_INVALID && elementType != DBUS_TYPE_STRING &&
            elementType != DBUS_TYPE_OBJECT_PATH)
            return fail(4);
        readTexts(inner, texts);
        entry.second = texts;
        return 0;
    }
    default:
        return fail(4);
    }
}

// ---- signals ----

std::string RemoteObject::matchRule(const std::string& signalName) const {
    return "type='signal',interface='" + interface + "',member='" + signalName + "',path='" + path +
           "'";
}

template <typename F>
int RemoteObject::addSignalHandler(std::list<SignalHandler<F> >& list, const char* signalName,
                                   F function) {
    if (signalName == 0) {
        BT_LOG_ERR("Match error (%s)", "no signal name");
        return -1;
    }
    if (connection == 0) {
        BT_LOG_ERR("Match error (%s)", "no connection to the bus");
        return -1;
    }
    ScopedError error;
    std::string rule = matchRule(signalName);
    dbus_bus_add_match(connection, rule.c_str(), error.get());
    dbus_connection_flush(connection);
    if (error.isSet()) {
        BT_LOG_ERR("Match error (%s)", error.text());
        return -1;
    }
    list.push_back(SignalHandler<F>(this, signalName, function));
    return 0;
}

template <typename F>
void RemoteObject::removeSignalHandlers(std::list<SignalHandler<F> >& list) {
    typename std::list<SignalHandler<F> >::iterator it = list.begin();
    while (it != list.end()) {
        if (it->object != this) {
            ++it;
            continue;
        }
        if (connection != 0) {
            ScopedError error;
            dbus_bus_remove_match(connection, matchRule(it->signalName).c_str(), error.get());
            if (error.isSet()) BT_LOG_ERR("Remove match error (%s)", error.text());
        }
        it = list.erase(it);
    }
}

int RemoteObject::setSignalHandlerNoArgument(const char* signalName,
                                             SignalFunctionNoArgument function) {
    return addSignalHandler(signalHandlerVectorNoArgument, signalName, function);
}

int RemoteObject::setSignalHandlerString(const char* signalName, SignalFunctionString function) {
    return addSignalHandler(signalHandlerVectorString, signalName, function);
}

int RemoteObject::setSignalHandlerObjectPath(const char* signalName,
                                             SignalFunctionObjectPath function) {
    return addSignalHandler(signalHandlerVectorObjectPath, signalName, function);
}

int RemoteObject::setSignalHandlerStringVariant(const char* signalName,
                                                SignalFunctionStringVariant function) {
    return addSignalHandler(signalHandlerVectorStringVariant, signalName, function);
}

int RemoteObject::setSignalHandlerStringDict(const char* signalName,
                                             SignalFunctionStringDict function) {
    return addSignalHandler(signalHandlerVectorStringDict, signalName, function);
}

namespace {

// Walks a handler list, calling visit(handler) for every handler that matches
// the signal; visit returns false to end the walk (a decoding failure). The
// iterator moves on before the call, so a handler may unlink its own node.
template <typename F, typename Visit>
void forMatching(std::list<SignalHandler<F> >& list, DBusMessage* message, Visit visit) {
    typename std::list<SignalHandler<F> >::iterator it = list.begin();
    while (it != list.end()) {
        typename std::list<SignalHandler<F> >::iterator current = it++;
        if (!dbus_message_is_signal(message, current->object->getInterface(),
                                    current->signalName.c_str()))
            continue;
        if (!visit(*current)) return;
    }
}

// Opens the signal's arguments and checks that the first is of the given type,
// logging why not.
bool firstArgument(DBusMessage* message, DBusMessageIter& arguments, int type,
                   const char* notThatType) {
    if (!dbus_message_iter_init(message, &arguments)) {
        BT_LOG_ERR("Signal has no arguments");
        return false;
    }
    if (basicTypeOf(arguments) != type) {
        BT_LOG_ERR("%s", notThatType);
        return false;
    }
    return true;
}

const char kNotString[] = "Argument is not string";

}  // namespace

void RemoteObject::signalHandlerDispatcherObjectPath(RemoteObject*, DBusMessage* message) {
    forMatching(signalHandlerVectorObjectPath, message,
                [message](SignalHandler<SignalFunctionObjectPath>& handler) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_OBJECT_PATH,
                                       "Argument is not object path"))
                        return false;
                    ObjectPath value(readText(arguments));
                    handler.function(handler.object, &value);
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherString(RemoteObject*, DBusMessage* message) {
    forMatching(signalHandlerVectorString, message,
                [message](SignalHandler<SignalFunctionString>& handler) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_STRING, kNotString))
                        return false;
                    std::string text = readText(arguments);
                    handler.function(handler.object, text.c_str());
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherStringVariant(RemoteObject* object, DBusMessage* message) {
    forMatching(signalHandlerVectorStringVariant, message,
                [object, message](SignalHandler<SignalFunctionStringVariant>& handler) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_STRING, kNotString))
                        return false;
                    Entry entry;
                    if (object->parseEntryName(arguments, entry) != 0) {
                        BT_LOG_ERR("Failed to parse string in signal");
                        return false;
                    }
                    dbus_message_iter_next(&arguments);
                    if (object->parseEntryValue(arguments, entry) != 0) {
                        BT_LOG_ERR("Failed to parse variant in signal");
                        return false;
                    }
                    handler.function(handler.object, entry.first.c_str(), &entry.second);
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherStringDict(RemoteObject* object, DBusMessage* message) {
    forMatching(signalHandlerVectorStringDict, message,
                [object, message](SignalHandler<SignalFunctionStringDict>& handler) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_STRING, kNotString))
                        return false;
                    std::string text = readText(arguments);
                    dbus_message_iter_next(&arguments);
                    if (basicTypeOf(arguments) != DBUS_TYPE_ARRAY ||
                        dbus_message_iter_get_element_type(&arguments) != DBUS_TYPE_DICT_ENTRY) {
                        BT_LOG_ERR("Argument is not dict");
                        return false;
                    }
                    Dict dict;
                    switch (object->decodeEntries(arguments, dict)) {
                    case kBadEntryName:
                        BT_LOG_ERR("Failed to parse entry name");
                        return false;
                    case kBadEntryValue:
                        BT_LOG_ERR("Failed to parse entry value");
                        return false;
                    }
                    handler.function(handler.object, text.c_str(), &dict);
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherNoArgument(RemoteObject* object, DBusMessage* message) {
    // Called with the dispatching object, not the handler's own: deliberate.
    forMatching(signalHandlerVectorNoArgument, message,
                [object](SignalHandler<SignalFunctionNoArgument>& handler) -> bool {
                    handler.function(object);
                    return true;
                });
}

// ---- receiving thread ----

int RemoteObject::startLoop() {
    // Counted before the thread runs, so that calls made right after this
    // already leave the connection's I/O to it; the thread uncounts itself.
    LoopState* state = connection != 0 ? prepareLoop(connection, this) : 0;
    if (state != 0) ++state->running;
    int result = pthread_create(&thread, 0, &receiveSignal, this);
    if (result != 0 && state != 0) --state->running;
    return result;
}

void RemoteObject::stopLoop() {
    gFlags[kStop] = 1;
    wakeAllLoops();
}

int RemoteObject::waitLoop() {
    if (pthread_equal(thread, pthread_t())) return ESRCH;  // never started, or joined already
    int result = pthread_join(thread, 0);
    thread = pthread_t();
    return result;
}

namespace {
// How long the loop leaves the socket to a thread that holds the I/O path.
const int kBackOffMs = 2;
}  // namespace

void* receiveSignal(void* data) {
    RemoteObject* object = static_cast<RemoteObject*>(data);
    tDispatching = object;
    DBusConnection* connection = object->connection;
    LoopState* state = 0;
    if (connection != 0) {
        std::lock_guard<std::mutex> lock(gLoopsLock);
        state = findLoop(connection);
    }
    while (!gFlags[kStop]) {
        if (connection == 0 || !dbus_connection_get_is_connected(connection)) {
            usleep(100000);
            continue;
        }
        if (dbus_connection_get_dispatch_status(connection) == DBUS_DISPATCH_DATA_REMAINS) {
            // Dispatching, rather than popping, lets every reply reach the call
            // waiting for it and every method call reach its object path.
            dbus_connection_dispatch(connection);
            ++gDispatches;
            continue;
        }
        if (waitReadable(connection, state, 100, true)) {
            dbus_connection_read_write(connection, 0);
            // Data on the socket that this thread could not read: another thread
            // holds the I/O path (a pending call's wait, or a blocking call in
            // libdbus's own wait) and will read it. Rather than spin on the
            // socket, wait for that thread to queue messages.
            if (dbus_connection_get_dispatch_status(connection) == DBUS_DISPATCH_COMPLETE)
                waitReadable(connection, state, kBackOffMs, false);
        } else {
            dbus_connection_read_write(connection, 0);
        }
    }
    if (state != 0) --state->running;
    tDispatching = 0;
    return 0;
}

namespace internal {

bool interruptedFlag() { return gFlags[kInterrupted] != 0; }
bool replyArrivedFlag() { return gFlags[kReplyArrived] != 0; }

}  // namespace internal

}  // namespace Bluetooth
