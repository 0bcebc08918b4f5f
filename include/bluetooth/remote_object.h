#ifndef BTBUS_BLUETOOTH_REMOTE_OBJECT_H
#define BTBUS_BLUETOOTH_REMOTE_OBJECT_H

#include <list>
#include <mutex>
#include <string>
#include <vector>

#include <dbus/dbus.h>
#include <pthread.h>

#include <bluetooth/object_path.h>
#include <bluetooth/variant.h>

namespace Bluetooth {

class RemoteObject;
namespace internal {
class OperationScope;
}

/// One registered signal handler: the proxy that registered it (not owned), the
/// signal's member name and the function to call.
template <typename F>
class SignalHandler {
public:
    /// A registration of function for signalName, made by object.
    SignalHandler(RemoteObject* object, const char* signalName, F function)
        : object(object), signalName(signalName), function(function), registration(0) {}
    virtual ~SignalHandler() {}

    RemoteObject* object;     ///< the registering proxy; not owned
    std::string signalName;   ///< the signal's member name
    F function;               ///< called for each matching signal
    /// Tells this registration from a later one at the same address.
    unsigned long registration;
};

/// Handler types, one per signal signature. The pointers handed to a handler are
/// owned by the dispatcher and valid only during the call.
///@{
typedef void (*SignalFunctionNoArgument)(RemoteObject* object);
typedef void (*SignalFunctionString)(RemoteObject* object, const char* text);
typedef void (*SignalFunctionObjectPath)(RemoteObject* object, const ObjectPath* path);
typedef void (*SignalFunctionStringVariant)(RemoteObject* object, const char* name,
                                            const Variant* value);
typedef void (*SignalFunctionStringDict)(RemoteObject* object, const char* name,
                                         const Dict* dict);
///@}

/// Client proxy for one object of another D-Bus peer: destination, path and
/// interface on one bus. Builds one method call at a time, sends it, reads the
/// reply, and keeps the error state of the latest operation:
///   0 none, 1 "Parameter is null", 2 "Reply message is null", 3 "Invalid path",
///   4 "Invalid reply value", 5 "Invalid reply format", 6 "Failed to create message",
///   7 "Failed to append args to message", 8 "Failed to append args = iterator",
///   9 "Failed to open container", 10 "Failed to send message",
///   11 the D-Bus error's own message (its name: getErrorName()).
/// Operations return 0 on success and -1 on failure.
///
/// Threads. One object is used by one thread at a time; different objects may be
/// used from any threads at once. Each bus connection has one loop:
/// - startLoop() starts a receiving thread for the object's connection. Signal
///   handlers, and the requests the process's Agent answers, run on a receiving
///   thread, one at a time, outside libdbus's own locks.
/// - Blocking calls from any thread, a handler included, wait without holding the
///   connection. A waiting thread reads a quick reply itself and leaves what else
///   it reads to a receiving thread; a free receiving thread reads slower replies;
///   while every receiving thread is busy in a handler, a waiting thread reads and
///   dispatches itself. sendMessagePending also answers the Agent's requests
///   meanwhile, so pairing works from any thread.
/// - A program may dispatch the connection with a loop of its own (a thread in
///   dbus_connection_read_write_dispatch, or GLib's after
///   dbus_connection_setup_with_g_main). Without a receiving thread, its loop
///   then runs the Agent and keeps the signals for itself. Inside its dispatch
///   (a filter, an object path, a dbus-glib callback) a blocking call waits as
///   libdbus does, dispatching nothing, and sendMessagePending fails at once
///   (error 11): create the library's objects before adding filters of the
///   program's own, so that the library sees each dispatch begin.
/// - A handler may make calls, register handlers, and create or destroy proxies,
///   its own included. Destroying a proxy removes its handlers and waits for a
///   handler of it that runs on another thread to return. Destroying the object a
///   loop was started on leaves the loop running without it.
/// - Signals that fail to decode set the error number of the object the loop was
///   started on, unless an operation of it runs at that moment: start the loop on
///   an object of its own to keep the two apart.
/// - Object paths registered on the connection by other code than the Agent are
///   called from whichever thread reads the connection: keep them quick.
class RemoteObject {
public:
    /// None of the texts may be null. Takes one reference on the shared connection
    /// of busType; a bus that cannot be reached leaves the connection null, and
    /// every later call then fails through the error state.
    RemoteObject(const char* destination, const char* path, const char* interface,
                 DBusBusType busType);
    /// Removes this object's signal handlers and their match rules, releases the
    /// reply and the outgoing message and drops the connection reference.
    virtual ~RemoteObject();

    /// The shared connection of the object's bus; null when it could not be reached.
    DBusConnection* getConnection() const;
    /// This process's unique name on the connection; "" without a connection.
    ///@{
    const char* getConnectionName() const;
    const char* getDestination() const;
    const char* getPath() const;
    const char* getInterface() const;
    ///@}
    /// "RemoteObject name: <destination>\nPath: <path>\nInterface: <interface>\n"
    std::string getInfo() const;
    /// Writes getInfo() to standard output; returns 0.
    int printInfo() const;

    /// Starts a new outgoing call to method (error 1 for null, 6 if libdbus
    /// cannot create it); any previous outgoing message is released.
    int newMessage(const char* method);
    /// Append one argument to the outgoing call (error 7 on failure).
    int append(bool value);                ///< BOOLEAN
    int append(const char* value);         ///< STRING; error 1 for null
    int append(const ObjectPath& path);    ///< OBJECT_PATH; error 3 unless it starts with "/"
    int append(unsigned int value);        ///< UINT32
    int append(unsigned short value);      ///< UINT16
    /// Appends a VARIANT of u, q, b or s for alternatives 0 to 3. Alternatives 4
    /// and 5 cannot be written: error 9, -1, nothing appended.
    int append(const Variant& value);

    /// Sends the outgoing call. waitReply: blocks for the reply (a D-Bus error or
    /// time-out gives error 11 with its message). Otherwise marks it no-reply,
    /// queues and flushes it (error 10 if it cannot be queued). timeout is in
    /// milliseconds, -1 for libdbus's default. The outgoing message is released
    /// in every case.
    int sendMessage(bool waitReply, int timeout);
    /// Takes ownership of reply (null gives error 2).
    int setReplyMessage(DBusMessage* reply);
    /// Sends the outgoing call and waits for its reply while dispatching the
    /// connection on this thread (so handlers of object paths registered on it,
    /// such as an Agent, keep answering), in 500 ms slices, until the reply
    /// arrives or SIGTERM or SIGINT is received; installs handlers for those two
    /// signals and leaves them installed. Returns 0 once the call was sent, even
    /// when the wait was interrupted: read the outcome with getReplyValue, which
    /// reports error 2 when no reply arrived. Only one may run per process.
    int sendMessagePending();

    /// Read the first argument of the reply. Every overload consumes the reply,
    /// whatever the outcome; with no reply present: error 2, -1.
    int getReplyValue(std::string& value);             ///< STRING, else error 4
    int getReplyValue(bool& value);                    ///< BOOLEAN, else error 4
    /// OBJECT_PATH: 0. A STRING (the form of an error reply): the path holds it,
    /// error 11 with that text, result -2. Any other type: error 11, -1.
    int getReplyValue(ObjectPath& value);
    /// An ARRAY of strings or object paths; not an array: error 4.
    ///@{
    int getReplyValue(std::vector<std::string>& values);
    int getReplyValue(std::vector<ObjectPath>& values);
    ///@}
    /// An array of dictionary entries (a{sv}, a{ss}, a{us}...); otherwise error 5.
    /// Decoding stops quietly at an entry with an empty name; entries decoded
    /// before a failure stay in dict.
    int getReplyValue(Dict& dict);

    /// Decode the iterator's current argument as an entry name (STRING, or UINT32
    /// as decimal text) or as an entry value (a STRING, or a VARIANT of u, q, b,
    /// s, o, n or an array of strings or paths); anything else gives error 4.
    /// Neither advances the iterator.
    ///@{
    int parseEntryName(DBusMessageIter& iterator, Entry& entry);
    int parseEntryValue(DBusMessageIter& iterator, Entry& entry);
    ///@}

    /// The error state of the latest operation: resetError clears it (number
    /// 0, text ""); getErrorMessage gives the number's text (for 11 the D-Bus
    /// error's own message; "Unknown error" for a number without one).
    ///@{
    void resetError();
    bool hasError() const;
    int getErrorNumber() const;
    std::string getErrorMessage();
    ///@}
    /// The D-Bus error name behind error 11 (for example
    /// "org.bluez.Error.AlreadyExists"); "" when there is none.
    std::string getErrorName() const;

    /// Register a handler for signalName of this object's interface: adds the
    /// match rule type='signal',interface='I',member='M',path='P' to the bus and
    /// appends the handler to the list of its signature. Returns -1 (and logs
    /// "Match error (...)") when the bus refuses the rule. Registering twice
    /// calls the handler twice per signal. Handlers match on interface and member
    /// only: a signal from any path the bus delivers reaches them.
    ///@{
    int setSignalHandlerNoArgument(const char* signalName, SignalFunctionNoArgument function);
    int setSignalHandlerString(const char* signalName, SignalFunctionString function);
    int setSignalHandlerObjectPath(const char* signalName, SignalFunctionObjectPath function);
    int setSignalHandlerStringVariant(const char* signalName,
                                      SignalFunctionStringVariant function);
    int setSignalHandlerStringDict(const char* signalName, SignalFunctionStringDict function);
    ///@}

    /// Starts the receiving thread for this object's connection; returns what
    /// pthread_create returns. The thread dispatches the connection: signals go
    /// to the handler lists, method calls to the object paths registered on it
    /// (an Agent), replies to the calls waiting for them. From the first object
    /// made for a connection, the connection survives a lost bus instead of
    /// exiting the process, and the library takes over its dispatch-status
    /// notification.
    int startLoop();
    /// Ends every receiving thread in the process at once (a thread in a handler
    /// ends when the handler returns); threads started afterwards end at once.
    /// Signals that arrive afterwards are dropped.
    void stopLoop();
    /// Joins the thread started by startLoop.
    int waitLoop();

    /// Offer one message to one handler list; the dispatching object's error
    /// state receives decoding errors. Called by the receiving thread in the order
    /// ObjectPath, StringVariant, String, StringDict, NoArgument.
    ///@{
    static void signalHandlerDispatcherObjectPath(RemoteObject* object, DBusMessage* message);
    static void signalHandlerDispatcherStringVariant(RemoteObject* object, DBusMessage* message);
    static void signalHandlerDispatcherString(RemoteObject* object, DBusMessage* message);
    static void signalHandlerDispatcherStringDict(RemoteObject* object, DBusMessage* message);
    static void signalHandlerDispatcherNoArgument(RemoteObject* object, DBusMessage* message);
    ///@}

    /// The process-wide handler lists, one per signature, in registration order.
    ///@{
    static std::list<SignalHandler<SignalFunctionNoArgument> > signalHandlerVectorNoArgument;
    static std::list<SignalHandler<SignalFunctionString> > signalHandlerVectorString;
    static std::list<SignalHandler<SignalFunctionObjectPath> > signalHandlerVectorObjectPath;
    static std::list<SignalHandler<SignalFunctionStringVariant> > signalHandlerVectorStringVariant;
    static std::list<SignalHandler<SignalFunctionStringDict> > signalHandlerVectorStringDict;
    ///@}

protected:
    std::string destination;   ///< the peer's bus name
    std::string path;          ///< the object's path
    std::string interface;     ///< the interface called and listened to
    DBusConnection* connection;  ///< one reference on the bus's shared connection
    DBusMessage* message;      ///< the outgoing call being built, or null
    DBusMessage* reply;        ///< the latest reply, until read, or null
    DBusBusType busType;       ///< the bus of the connection
    pthread_t thread;          ///< the receiving thread startLoop started
    int errorNumber;           ///< 0, or the latest operation's error
    std::string errorMessage;  ///< the text behind errorNumber 11

    /// Sets the error number (and, for 11, the text and name) and returns -1.
    int fail(int number, const char* text = 0, const char* name = 0);
    /// Removes this object's handlers and their match rules, then waits for its
    /// handlers that run on other threads. Idempotent; a class whose handlers
    /// look at more than the RemoteObject calls it first in its destructor.
    void releaseHandlers();

private:
    friend class internal::OperationScope;

    RemoteObject(const RemoteObject&) = delete;
    RemoteObject& operator=(const RemoteObject&) = delete;

    // Instantiated inside the library only, for its five lists: not exported.
    template <typename F>
    __attribute__((visibility("hidden"))) int addSignalHandler(std::list<SignalHandler<F> >& list,
                                                               const char* signalName, F function);
    template <typename F>
    __attribute__((visibility("hidden"))) void removeSignalHandlers(std::list<SignalHandler<F> >& list,
                                                                    std::vector<std::string>& rules);
    /// A signal that cannot be decoded: logs what (at line of the dispatcher) and
    /// records number on the dispatching object, if any, unless an operation runs
    /// on it. Returns false, the dispatchers' "not handled".
    ///@{
    static bool signalUndecodable(RemoteObject* dispatching, int number, int line, const char* what);
    std::string matchRule(const std::string& signalName) const;
    void releaseReply();
    void releaseMessage();
    ///@}
    /// Takes the reply out of this object (the caller releases it) and opens an
    /// iterator on its arguments; with no reply present, error 2 and null.
    DBusMessage* takeReply(DBusMessageIter& iterator);
    /// Why nothing can be sent now (no connection, no message), or null.
    ///@{
    const char* cannotSend() const;
    int readStringArray(std::vector<std::string>& values);
    ///@}

    std::string errorName;
    mutable std::mutex errorLock;  ///< the error state: signals may write it from a receiving thread
    int operationDepth;            ///< proxy operations running on this object
    bool handlersReleased;
};

/// The receiving thread's function; object is the RemoteObject that started it.
void* receiveSignal(void* object);

}  // namespace Bluetooth

#endif
