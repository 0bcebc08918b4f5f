#ifndef BTBUS_BLUETOOTH_AGENT_H
#define BTBUS_BLUETOOTH_AGENT_H

#include <string>

#include <dbus/dbus.h>

namespace Bluetooth {

/// A BlueZ 4 pairing agent ("org.bluez.Agent") that this process serves on the
/// system bus at "/org/bluez/agent_<pid>". It answers with fixed, pre-set
/// values: the passkey text, after an optional delay, or a refusal when the
/// reject flag is set. Its handlers run on whichever thread dispatches the
/// system-bus connection (a receiving thread, the thread waiting in
/// Adapter::createPairedDevice, or the program's own loop); set everything
/// before registerPath.
class Agent {
public:
    static const char* const PSZ_NO_INPUT_NO_OUTPUT;  ///< "NoInputNoOutput"
    static const char* const PSZ_KEYBOARD_ONLY;       ///< "KeyboardOnly"
    static const char* const PSZ_DISPLAY_YES_NO;      ///< "DisplayYesNo"
    static const char* const PSZ_DISPLAY_ONLY;        ///< "DisplayOnly"

    /// Passkey "7391", no delay, no rejection, capability "DisplayYesNo". The
    /// path is not registered yet.
    Agent();
    /// Call unregisterPath first; a path still registered for this agent is
    /// unregistered here, and a request running on another thread is waited for.
    virtual ~Agent();

    /// Builds the path and registers it on the system bus; 0, or -1 (logged).
    int registerPath();
    /// Unregisters the path from the system bus; 0, or -1 (logged).
    int unregisterPath();

    /// "" until registerPath built it.
    const char* getPath() const;
    /// Always "org.bluez.Agent".
    const char* getInterface() const;

    /// Copies the text; null is refused (-1, logged).
    int setPasskeyValue(const char* value);
    /// The passkey text; "7391" until set.
    const char* getPasskeyValue() const;
    /// Whole seconds to sleep before answering; negative is refused (-1, logged)
    /// and the old value kept.
    int setPasskeyDelay(int seconds);
    /// The delay in seconds; 0 until set.
    int getPasskeyDelay() const;
    /// When set, RequestPasskey, RequestConfirmation and Authorize are answered
    /// with org.bluez.Error.Rejected; RequestPinCode is still answered.
    void setReject(bool reject);
    /// Whether requests are rejected; false until set.
    bool getReject() const;
    /// The pointer is kept, not copied: the caller keeps the text alive. Null is
    /// refused (-1).
    int setCapability(const char* capability);
    /// The capability given to bluetoothd; "DisplayYesNo" until set.
    const char* getCapability() const;
    /// Replaces the function that receives the path's messages; it takes effect
    /// at the next registerPath, not for a path registered already. Null is
    /// refused (-1).
    int setDispatcher(DBusObjectPathMessageFunction function);

    /// The answers to bluetoothd's calls; agent is the Agent the message is for.
    ///@{
    static DBusHandlerResult requestPinCode(DBusConnection* connection, DBusMessage* message,
                                            Agent* agent);
    static DBusHandlerResult requestPasskey(DBusConnection* connection, DBusMessage* message,
                                            Agent* agent);
    static DBusHandlerResult requestConfirmation(DBusConnection* connection,
                                                 DBusMessage* message, Agent* agent);
    static DBusHandlerResult authorize(DBusConnection* connection, DBusMessage* message,
                                       Agent* agent);
    static DBusHandlerResult cancel(DBusConnection* connection, DBusMessage* message,
                                    Agent* agent);
    static DBusHandlerResult release(DBusConnection* connection, DBusMessage* message,
                                     Agent* agent);
    ///@}
    /// Exist but are not dispatched: the default message function leaves those
    /// calls unhandled, and libdbus answers them with UnknownMethod.
    ///@{
    static DBusHandlerResult displayPasskey(DBusConnection* connection, DBusMessage* message,
                                            Agent* agent);
    static DBusHandlerResult confirmModeChange(DBusConnection* connection,
                                               DBusMessage* message, Agent* agent);
    ///@}

    /// The default message function: hands RequestPinCode, RequestPasskey,
    /// RequestConfirmation, Authorize, Cancel and Release to their handlers and
    /// logs any other message, which it leaves unhandled. userData is the Agent.
    static DBusHandlerResult handlerDispatcher(DBusConnection* connection, DBusMessage* message,
                                               void* userData);
    /// Does nothing.
    static void handlerUnregisterDispatcher(DBusConnection* connection, void* userData);

protected:
    std::string path;               ///< "/org/bluez/agent_<pid>" once registered
    DBusObjectPathVTable* vtable;   ///< malloc'ed; only the message function is set
    std::string passkeyValue;       ///< the answer to PIN and passkey requests
    int passkeyDelay;               ///< seconds to wait before answering
    bool reject;                    ///< whether answerable requests are rejected
    const char* capability;         ///< not owned

private:
    Agent(const Agent&) = delete;  ///< the table is owned
    Agent& operator=(const Agent&) = delete;
};

}  // namespace Bluetooth

#endif
