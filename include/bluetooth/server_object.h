#ifndef BTBUS_BLUETOOTH_SERVER_OBJECT_H
#define BTBUS_BLUETOOTH_SERVER_OBJECT_H

#include <dbus/dbus-glib.h>
#include <dbus/dbus.h>
#include <glib-object.h>

namespace Bluetooth {

/// Base of a D-Bus service object served through dbus-glib: it takes the bus's
/// connection, claims a well-known name, registers a GObject at a path and runs
/// a GLib main loop with a one-second timer that calls callbackThreadHandler.
/// The main loop is written for ScannerServer: startLoop does nothing for any
/// other derived class.
///
/// Threads. The thread that calls startLoop runs the GLib main loop on the
/// default main context: every incoming method call and the timer run there.
/// GLib dispatches the service's own connection only. The client core's
/// receiving thread (RemoteObject::startLoop) dispatches the system bus for the
/// BlueZ proxies beside it. Do not serve a ServerObject on the system bus in a
/// process that uses the BlueZ proxies: dbus-glib would hand out the proxies'
/// own shared system connection, and two threads would then dispatch it.
class ServerObject {
public:
    /// busName and path are stored, not copied: they must outlive the object.
    /// Takes the bus connection and a proxy for the bus daemon; when the bus
    /// cannot be reached both stay null and prepareObjectInfo fails.
    ServerObject(const char* busName, const char* path, DBusBusType busType);
    /// Releases the bus daemon proxy; the shared connection stays open.
    virtual ~ServerObject();

    /// The per-tick hook of the timer; true keeps the timer. The base version
    /// only returns true, so the timer of a class without a hook ticks forever.
    virtual bool callbackThreadHandler(void* data);

    /// The connection, taken on first use; null when the bus cannot be reached.
    DBusGConnection* getConnection();

    /// Installs info for type, requests busName from the bus (queued behind
    /// another owner counts as success) and registers object at path. False,
    /// logged as "Failed to acquire <name>, <why>", when the request fails.
    bool prepareObjectInfo(GType type, const DBusGObjectInfo* info, GObject* object);

    /// For a ScannerServer: starts the receiving thread on its Manager, runs
    /// the main loop on this thread until it is quit, then ends every receiving
    /// thread of the process (final, see RemoteObject::stopLoop) and waits for
    /// the one it started. Returns at once for any other class and while a loop
    /// already runs.
    void startLoop();
    /// Quits the running loop; nothing without one. From any thread.
    void quitLoop();

    /// Three lines: "ServerObject name: ", "Path: ", "Interface: " followed by
    /// the bus daemon proxy's name, path and interface (not the service's own).
    void printInfo() const;
    /// This process's unique name on the connection; null without one.
    const char* getConnectionName() const;
    /// The bus daemon proxy's name, path and interface; null without a proxy.
    ///@{
    const char* getBusName() const;
    const char* getPath() const;
    const char* getInterface() const;
    ///@}

protected:
    GMainLoop* loop;               ///< the running main loop, or null
    DBusGProxy* proxy;             ///< the bus daemon's proxy; one reference
    DBusGConnection* connection;   ///< null until obtained; not released
    DBusBusType busType;           ///< the bus the service is served on
    const char* busName;           ///< the caller's text, not copied
    const char* path;              ///< the caller's text, not copied

private:
    ServerObject(const ServerObject&) = delete;
    ServerObject& operator=(const ServerObject&) = delete;
};

/// The timer's callback; data is the ServerObject. Returns its
/// callbackThreadHandler(data); false removes the timer.
gboolean updateTimer(void* data);

}  // namespace Bluetooth

#endif
