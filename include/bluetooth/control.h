#ifndef BTBUS_BLUETOOTH_CONTROL_H
#define BTBUS_BLUETOOTH_CONTROL_H

#include <bluetooth/bluez_object.h>

namespace Bluetooth {

/// Handler of the remote control's argument-less signals: called with the proxy
/// whose receiving thread runs, not necessarily the one that registered it.
typedef void (*ControlSignalHandler)(RemoteObject* object);

/// Proxy for the remote-control profile of one device ("org.bluez.Control").
class Control : public BluezObject {
public:
    /// A proxy for the device at path; no bus traffic.
    explicit Control(const char* path);
    virtual ~Control();

    /// A new Control for path, or null when bluetoothd is not on the bus.
    static Control* getControl(const char* path);

    /// "IsConnected": 0 with the answer in connected (untouched on failure), or
    /// -1 (logged).
    int isConnected(bool& connected);
    /// Send the volume keys without waiting; 0 when sent, else -1 (logged).
    ///@{
    int volumeDown();
    int volumeUp();
    ///@}

    /// Register handlers for "Connected" and "Disconnected"; null installs the
    /// default handler below.
    ///@{
    int setConnectedHandler(ControlSignalHandler handler);
    int setDisconnectedHandler(ControlSignalHandler handler);
    ///@}

    static void connectedHandler(RemoteObject* object);     ///< "Connected from <path>"
    static void disconnectedHandler(RemoteObject* object);  ///< "Disconnected from <path>"
};

}  // namespace Bluetooth

#endif
