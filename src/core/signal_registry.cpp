// The five process-wide handler lists, their lock, their match rules and the
// dispatchers.
#include <bluetooth/remote_object.h>

#include <mutex>

#include "core/connection_loop.h"
#include "core/dbus_holders.h"
#include "core/decode.h"
#include "core/log.h"
#include "core/owner_watch.h"

BT_LOG_FILE("remote_object.cpp");

namespace Bluetooth {

std::list<SignalHandler<SignalFunctionNoArgument> > RemoteObject::signalHandlerVectorNoArgument;
std::list<SignalHandler<SignalFunctionString> > RemoteObject::signalHandlerVectorString;
std::list<SignalHandler<SignalFunctionObjectPath> > RemoteObject::signalHandlerVectorObjectPath;
std::list<SignalHandler<SignalFunctionStringVariant> >
    RemoteObject::signalHandlerVectorStringVariant;
std::list<SignalHandler<SignalFunctionStringDict> > RemoteObject::signalHandlerVectorStringDict;

namespace {

using internal::ScopedError;
using internal::readText;
using internal::typeOf;

// Guards the five lists. Never held across a call to the bus or a handler.
std::mutex gListsLock;
// Counts unlinks: a walk that sees it change checks that a handler it found
// before a call is still listed.
unsigned long gUnlinks = 0;
unsigned long gRegistrations = 0;

template <typename F>
bool stillListed(const std::list<SignalHandler<F> >& list, unsigned long registration) {
    for (typename std::list<SignalHandler<F> >::const_iterator it = list.begin(); it != list.end();
         ++it)
        if (it->registration == registration) return true;
    return false;
}

// Calls visit(object, function) for every handler of list that matches the
// signal, in list order; visit returns false to end the walk (a decoding
// failure). Handlers run without the lock and may register and unregister:
// one that is unlinked before its turn is not called, one added meanwhile
// waits for the next signal.
template <typename F, typename Visit>
void forMatching(std::list<SignalHandler<F> >& list, DBusMessage* message, Visit visit) {
    struct Match {
        unsigned long registration;
        RemoteObject* object;
        F function;
    };
    std::vector<Match> matches;
    unsigned long unlinks;
    {
        std::lock_guard<std::mutex> hold(gListsLock);
        for (typename std::list<SignalHandler<F> >::iterator it = list.begin(); it != list.end(); ++it)
            if (dbus_message_is_signal(message, it->object->getInterface(), it->signalName.c_str())) {
                Match match = { it->registration, it->object, it->function };
                matches.push_back(match);
            }
        unlinks = gUnlinks;
    }
    for (size_t i = 0; i < matches.size(); ++i) {
        {
            std::lock_guard<std::mutex> hold(gListsLock);
            if (gUnlinks != unlinks && !stillListed(list, matches[i].registration)) continue;
            internal::beginUse(matches[i].object);  // its destruction now waits for the call
        }
        bool goOn = visit(matches[i].object, matches[i].function);
        internal::endUse(matches[i].object);
        if (!goOn) return;
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
    if (typeOf(arguments) != type) {
        BT_LOG_ERR("%s", notThatType);
        return false;
    }
    return true;
}

const char kNotString[] = "Argument is not string";

}  // namespace

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
    std::lock_guard<std::mutex> hold(gListsLock);
    list.push_back(SignalHandler<F>(this, signalName, function));
    list.back().registration = ++gRegistrations;
    return 0;
}

// Unlinks this object's handlers from list, collecting their match rules.
template <typename F>
void RemoteObject::removeSignalHandlers(std::list<SignalHandler<F> >& list,
                                        std::vector<std::string>& rules) {
    typename std::list<SignalHandler<F> >::iterator it = list.begin();
    while (it != list.end()) {
        if (it->object != this) {
            ++it;
            continue;
        }
        rules.push_back(matchRule(it->signalName));
        it = list.erase(it);
        ++gUnlinks;
    }
}

void RemoteObject::releaseHandlers() {
    if (handlersReleased) return;
    handlersReleased = true;
    std::vector<std::string> rules;
    {
        std::lock_guard<std::mutex> hold(gListsLock);
        removeSignalHandlers(signalHandlerVectorNoArgument, rules);
        removeSignalHandlers(signalHandlerVectorString, rules);
        removeSignalHandlers(signalHandlerVectorObjectPath, rules);
        removeSignalHandlers(signalHandlerVectorStringVariant, rules);
        removeSignalHandlers(signalHandlerVectorStringDict, rules);
    }
    for (size_t i = 0; connection != 0 && i < rules.size(); ++i) {
        ScopedError error;
        dbus_bus_remove_match(connection, rules[i].c_str(), error.get());
        if (error.isSet()) BT_LOG_ERR("Remove match error (%s)", error.text());
    }
    internal::unwatchOwners(*this);
    internal::ConnectionLoop::forgetOwner(this);
    internal::waitUnused(this);
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

bool RemoteObject::signalUndecodable(RemoteObject* dispatching, int number, int line,
                                     const char* what) {
    internal::logError(kLogFile, line, "%s", what);
    if (dispatching == 0) return false;
    std::lock_guard<std::mutex> hold(dispatching->errorLock);
    // An operation running on another thread keeps its own outcome.
    if (dispatching->operationDepth == 0) dispatching->errorNumber = number;
    return false;
}

void RemoteObject::signalHandlerDispatcherObjectPath(RemoteObject*, DBusMessage* message) {
    forMatching(signalHandlerVectorObjectPath, message,
                [message](RemoteObject* object, SignalFunctionObjectPath function) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_OBJECT_PATH,
                                       "Argument is not object path"))
                        return false;
                    ObjectPath value(readText(arguments));
                    function(object, &value);
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherString(RemoteObject*, DBusMessage* message) {
    forMatching(signalHandlerVectorString, message,
                [message](RemoteObject* object, SignalFunctionString function) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_STRING, kNotString))
                        return false;
                    function(object, readText(arguments));
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherStringVariant(RemoteObject* dispatching,
                                                        DBusMessage* message) {
    forMatching(signalHandlerVectorStringVariant, message,
                [dispatching, message](RemoteObject* object,
                                       SignalFunctionStringVariant function) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_STRING, kNotString))
                        return false;
                    Entry entry;
                    int number = internal::decodeName(arguments, entry.first);
                    if (number != 0)
                        return signalUndecodable(dispatching, number, __LINE__,
                                                 "Failed to parse string in signal");
                    dbus_message_iter_next(&arguments);
                    number = internal::decodeValue(arguments, entry.second);
                    if (number != 0)
                        return signalUndecodable(dispatching, number, __LINE__,
                                                 "Failed to parse variant in signal");
                    function(object, entry.first.c_str(), &entry.second);
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherStringDict(RemoteObject* dispatching,
                                                     DBusMessage* message) {
    forMatching(signalHandlerVectorStringDict, message,
                [dispatching, message](RemoteObject* object,
                                       SignalFunctionStringDict function) -> bool {
                    DBusMessageIter arguments;
                    if (!firstArgument(message, arguments, DBUS_TYPE_STRING, kNotString))
                        return false;
                    const char* text = readText(arguments);
                    dbus_message_iter_next(&arguments);
                    if (typeOf(arguments) != DBUS_TYPE_ARRAY ||
                        dbus_message_iter_get_element_type(&arguments) != DBUS_TYPE_DICT_ENTRY) {
                        BT_LOG_ERR("Argument is not dict");
                        return false;
                    }
                    Dict dict;
                    switch (internal::decodeEntries(arguments, dict)) {
                    case internal::kBadEntryName:
                        return signalUndecodable(dispatching, 4, __LINE__, "Failed to parse entry name");
                    case internal::kBadEntryValue:
                        return signalUndecodable(dispatching, 4, __LINE__, "Failed to parse entry value");
                    case internal::kEntriesDecoded:
                        break;
                    }
                    function(object, text, &dict);
                    return true;
                });
}

void RemoteObject::signalHandlerDispatcherNoArgument(RemoteObject* dispatching,
                                                     DBusMessage* message) {
    // Called with the dispatching object, not the handler's own: deliberate. A
    // loop whose object is gone passes the handler's own instead.
    forMatching(signalHandlerVectorNoArgument, message,
                [dispatching](RemoteObject* object, SignalFunctionNoArgument function) -> bool {
                    function(dispatching != 0 ? dispatching : object);
                    return true;
                });
}

}  // namespace Bluetooth
