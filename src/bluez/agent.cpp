#include <bluetooth/agent.h>

#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <sstream>

#include <unistd.h>

#include <bluetooth/connection.h>

#include "core/connection_loop.h"
#include "core/dbus_holders.h"
#include "core/log.h"

BT_LOG_FILE("agent.cpp");

namespace Bluetooth {

const char* const Agent::PSZ_NO_INPUT_NO_OUTPUT = "NoInputNoOutput";
const char* const Agent::PSZ_KEYBOARD_ONLY = "KeyboardOnly";
const char* const Agent::PSZ_DISPLAY_YES_NO = "DisplayYesNo";
const char* const Agent::PSZ_DISPLAY_ONLY = "DisplayOnly";

namespace {

const char kInterface[] = "org.bluez.Agent";
const char kPathPrefix[] = "/org/bluez/agent_";
const char kRejected[] = "org.bluez.Error.Rejected";

const int kRegisterLine = 54;
const int kUnregisterLine = 65;
const int kNullPasskeyLine = 87;
const int kNegativeDelayLine = 106;
const int kNoHandlerLine = 410;

const DBusHandlerResult kHandled = DBUS_HANDLER_RESULT_HANDLED;
const DBusHandlerResult kNotYetHandled = DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
const DBusHandlerResult kNeedMemory = DBUS_HANDLER_RESULT_NEED_MEMORY;

enum Answer { kEmpty, kPasskeyText, kPasskeyNumber };

// One request bluetoothd makes of the agent, and how it is answered.
struct Request {
    const char* member;
    const char* arguments;  // the argument types read: o, u, s
    const char* what;       // the request's name in the log texts
    int badArgumentsLine;
    DBusHandlerResult badArgumentsResult;
    int noErrorLine;        // 0: the reject flag is not honoured
    bool delays;
    int noReplyLine;
    Answer answer;
};

enum { kPinCode, kPasskey, kConfirmation, kAuthorize, kCancel, kRelease };
// deliberate asymmetries: a PIN request ignores the reject flag and counts bad
// arguments as handled; every other request leaves them unhandled.
const Request kRequests[] = {
    { "RequestPinCode", "o", "request pin code", 167, kHandled, 0, true, 173, kPasskeyText },
    { "RequestPasskey", "o", "request passkey", 200, kNotYetHandled, 209, true, 216,
      kPasskeyNumber },
    { "RequestConfirmation", "ou", "request confirmation", 252, kNotYetHandled, 260, true, 268,
      kEmpty },
    { "Authorize", "os", "authorize", 293, kNotYetHandled, 302, false, 310, kEmpty },
    { "Cancel", "", "cancel", 337, kNotYetHandled, 0, false, 344, kEmpty },
    { "Release", "", "release", 363, kNotYetHandled, 0, false, 371, kEmpty },
};
const size_t kRequestCount = sizeof kRequests / sizeof kRequests[0];

void logBadArguments(const Request& request) {
    internal::logError(kLogFile, request.badArgumentsLine,
                       "Failed to get argument from %s message.", request.what);
}

void logNoReply(const Request& request, int line) {
    internal::logError(kLogFile, line, "Failed to create reply message when handling %s message.",
                       request.what);
}

// Reads the request's arguments as dbus_message_get_args does.
bool readArguments(DBusMessage* message, const char* types) {
    internal::ScopedError error;
    const char* device = 0;
    const char* text = 0;
    dbus_uint32_t number = 0;
    dbus_bool_t read = FALSE;
    if (std::strcmp(types, "o") == 0)
        read = dbus_message_get_args(message, error.get(), DBUS_TYPE_OBJECT_PATH, &device,
                                     DBUS_TYPE_INVALID);
    else if (std::strcmp(types, "ou") == 0)
        read = dbus_message_get_args(message, error.get(), DBUS_TYPE_OBJECT_PATH, &device,
                                     DBUS_TYPE_UINT32, &number, DBUS_TYPE_INVALID);
    else if (std::strcmp(types, "os") == 0)
        read = dbus_message_get_args(message, error.get(), DBUS_TYPE_OBJECT_PATH, &device,
                                     DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID);
    else
        read = dbus_message_get_args(message, error.get(), DBUS_TYPE_INVALID);
    return read != 0;
}

// The method return for a request, or null when it cannot be made.
DBusMessage* newAnswer(DBusMessage* message, const Request& request, const Agent& agent) {
    // libdbus aborts when asked to answer a message that was never sent.
    if (dbus_message_get_serial(message) == 0) return 0;
    internal::MessagePtr reply(dbus_message_new_method_return(message));
    if (!reply) return 0;
    if (request.answer == kPasskeyText) {
        const char* text = agent.getPasskeyValue();
        // libdbus aborts on invalid UTF-8 instead of failing the append.
        if (!dbus_validate_utf8(text, 0) ||
            !dbus_message_append_args(reply.get(), DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID))
            return 0;
    } else if (request.answer == kPasskeyNumber) {
        dbus_uint32_t number =
            static_cast<dbus_uint32_t>(std::strtoul(agent.getPasskeyValue(), 0, 10));
        if (!dbus_message_append_args(reply.get(), DBUS_TYPE_UINT32, &number, DBUS_TYPE_INVALID))
            return 0;
    }
    return reply.release();
}

DBusHandlerResult answer(DBusConnection* connection, DBusMessage* message, Agent* agent,
                         const Request& request) {
    if (message == 0 || agent == 0 || !readArguments(message, request.arguments)) {
        logBadArguments(request);
        return request.badArgumentsResult;  // no reply
    }
    DBusMessage* reply = 0;
    if (request.noErrorLine != 0 && agent->getReject()) {
        if (dbus_message_get_serial(message) != 0)
            reply = dbus_message_new_error(message, kRejected, "");
        if (reply == 0) {
            // Nothing can be sent: BlueZ gets no answer, as with any reply
            // that could not be made.
            logNoReply(request, request.noErrorLine);
            return kNeedMemory;
        }
    } else {
        if (request.delays && agent->getPasskeyDelay() > 0)
            sleep(static_cast<unsigned int>(agent->getPasskeyDelay()));
        reply = newAnswer(message, request, *agent);
        if (reply == 0) {
            logNoReply(request, request.noReplyLine);
            return kNeedMemory;
        }
    }
    if (connection != 0) {
        dbus_connection_send(connection, reply, 0);
        dbus_connection_flush(connection);
    }
    dbus_message_unref(reply);
    return kHandled;
}

// The message function each registered path was registered with: as libdbus
// keeps a copy of the handler table, a later setDispatcher waits for the next
// registration.
std::mutex gRegisteredLock;
std::map<const Agent*, DBusObjectPathMessageFunction> gRegistered;

void setRegistered(const Agent* agent, DBusObjectPathMessageFunction function) {
    std::lock_guard<std::mutex> hold(gRegisteredLock);
    if (function != 0)
        gRegistered[agent] = function;
    else
        gRegistered.erase(agent);
}

DBusHandlerResult deferRequest(DBusConnection* connection, DBusMessage* request, void* data) {
    DBusObjectPathMessageFunction function = 0;
    {
        std::lock_guard<std::mutex> hold(gRegisteredLock);
        std::map<const Agent*, DBusObjectPathMessageFunction>::iterator found =
            gRegistered.find(static_cast<const Agent*>(data));
        if (found != gRegistered.end()) function = found->second;
    }
    if (function == 0) return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
    DBusHandlerResult result = internal::ConnectionLoop::of(connection)->defer(request, function, data);
    // libdbus would dispatch the request again and again: an answer that could
    // not be made is no shortage of memory that time may cure.
    return result == kNeedMemory ? kHandled : result;
}

}  // namespace

Agent::Agent()
    : path(),
      vtable(static_cast<DBusObjectPathVTable*>(std::malloc(sizeof(DBusObjectPathVTable)))),
      passkeyValue("7391"),
      passkeyDelay(0),
      reject(false),
      capability(PSZ_DISPLAY_YES_NO) {
    if (vtable != 0) {
        std::memset(vtable, 0, sizeof *vtable);
        vtable->message_function = &handlerDispatcher;
    }
}

Agent::~Agent() {
    // Owners are meant to unregister first; one that forgot costs nothing.
    void* owner = 0;
    DBusConnection* connection = path.empty() ? 0 : Connection::get(DBUS_BUS_SYSTEM);
    if (connection != 0) {
        if (dbus_connection_get_object_path_data(connection, path.c_str(), &owner) && owner == this)
            dbus_connection_unregister_object_path(connection, path.c_str());
        Connection::unref(connection);
    }
    setRegistered(this, 0);
    internal::ConnectionLoop::forgetMethodCalls(this);
    std::free(vtable);
}

int Agent::registerPath() {
    std::ostringstream built;
    built << kPathPrefix << getpid();
    std::istringstream(built.str()) >> path;
    bool registered = false;
    DBusConnection* connection = Connection::get(DBUS_BUS_SYSTEM);
    if (connection != 0) {
        internal::ConnectionLoop::of(connection);  // its filter sees the program's own dispatch
        internal::ScopedError error;
        // The quiet form: an already registered path is reported here, not on stderr.
        // Requests reach the handler table through the connection's loop, which
        // runs them outside libdbus's dispatch, on a thread that may wait (the
        // delay) without holding up anyone's replies.
        static const DBusObjectPathVTable kDeferred = { 0, &deferRequest, 0, 0, 0, 0 };
        registered = vtable != 0 && dbus_connection_try_register_object_path(
                                        connection, path.c_str(), &kDeferred, this, error.get());
        if (registered) setRegistered(this, vtable->message_function);
        Connection::unref(connection);  // the registration stays on the shared connection
    }
    if (!registered) {
        internal::logError(kLogFile, kRegisterLine, "Failed to register agent path to dbus.");
        return -1;
    }
    return 0;
}

int Agent::unregisterPath() {
    bool unregistered = false;
    DBusConnection* connection = Connection::get(DBUS_BUS_SYSTEM);
    if (connection != 0) {
        // libdbus treats unregistering a path it does not hold as a caller bug
        // and may abort, so that case is reported as a failure here instead.
        void* owner = 0;
        if (!path.empty() &&
            dbus_connection_get_object_path_data(connection, path.c_str(), &owner) &&
            owner == this)
            unregistered = dbus_connection_unregister_object_path(connection, path.c_str());
        if (unregistered) setRegistered(this, 0);
        Connection::unref(connection);
    }
    if (!unregistered) {
        internal::logError(kLogFile, kUnregisterLine,
                           "Failed to unregister agent path from dbus.");
        return -1;
    }
    return 0;
}

const char* Agent::getPath() const { return path.c_str(); }

const char* Agent::getInterface() const { return kInterface; }

int Agent::setPasskeyValue(const char* value) {
    if (value == 0) {
        internal::logError(kLogFile, kNullPasskeyLine, "Failed to set null passkey value.");
        return -1;
    }
    passkeyValue = value;
    return 0;
}

const char* Agent::getPasskeyValue() const { return passkeyValue.c_str(); }

int Agent::setPasskeyDelay(int seconds) {
    if (seconds < 0) {
        // deliberate: "negitive" is misspelt in the log text.
        internal::logError(kLogFile, kNegativeDelayLine, "Failed to set negitive passkey delay.");
        return -1;
    }
    passkeyDelay = seconds;
    return 0;
}

int Agent::getPasskeyDelay() const { return passkeyDelay; }

void Agent::setReject(bool value) { reject = value; }

bool Agent::getReject() const { return reject; }

int Agent::setCapability(const char* value) {
    if (value == 0) return -1;
    capability = value;
    return 0;
}

const char* Agent::getCapability() const { return capability; }

int Agent::setDispatcher(DBusObjectPathMessageFunction function) {
    if (function == 0 || vtable == 0) return -1;
    vtable->message_function = function;
    return 0;
}

DBusHandlerResult Agent::requestPinCode(DBusConnection* connection, DBusMessage* message,
                                        Agent* agent) {
    return answer(connection, message, agent, kRequests[kPinCode]);
}

DBusHandlerResult Agent::requestPasskey(DBusConnection* connection, DBusMessage* message,
                                        Agent* agent) {
    return answer(connection, message, agent, kRequests[kPasskey]);
}

DBusHandlerResult Agent::requestConfirmation(DBusConnection* connection, DBusMessage* message,
                                             Agent* agent) {
    return answer(connection, message, agent, kRequests[kConfirmation]);
}

DBusHandlerResult Agent::authorize(DBusConnection* connection, DBusMessage* message,
                                   Agent* agent) {
    return answer(connection, message, agent, kRequests[kAuthorize]);
}

DBusHandlerResult Agent::cancel(DBusConnection* connection, DBusMessage* message, Agent* agent) {
    return answer(connection, message, agent, kRequests[kCancel]);
}

DBusHandlerResult Agent::release(DBusConnection* connection, DBusMessage* message, Agent* agent) {
    return answer(connection, message, agent, kRequests[kRelease]);
}

DBusHandlerResult Agent::displayPasskey(DBusConnection*, DBusMessage*, Agent*) {
    return kNotYetHandled;
}

DBusHandlerResult Agent::confirmModeChange(DBusConnection*, DBusMessage*, Agent*) {
    return kHandled;
}

DBusHandlerResult Agent::handlerDispatcher(DBusConnection* connection, DBusMessage* message,
                                           void* userData) {
    typedef DBusHandlerResult (*Handler)(DBusConnection*, DBusMessage*, Agent*);
    // In the order of kRequests.
    static const Handler kHandlers[] = { &requestPinCode, &requestPasskey, &requestConfirmation,
                                         &authorize, &cancel, &release };
    Agent* agent = static_cast<Agent*>(userData);
    for (size_t i = 0; message != 0 && agent != 0 && i < kRequestCount; ++i)
        if (dbus_message_is_method_call(message, kInterface, kRequests[i].member))
            return kHandlers[i](connection, message, agent);
    internal::logError(kLogFile, kNoHandlerLine,
                       "Registered agent does not provide a handler for the incoming message.");
    return kNotYetHandled;
}

void Agent::handlerUnregisterDispatcher(DBusConnection*, void*) {}

}  // namespace Bluetooth
