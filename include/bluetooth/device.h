#ifndef BTBUS_BLUETOOTH_DEVICE_H
#define BTBUS_BLUETOOTH_DEVICE_H

#include <bluetooth/bluez_object.h>

namespace Bluetooth {

/// Handler of the argument-less "DisconnectRequested": called with the proxy
/// whose receiving thread runs, not necessarily the one that registered it.
typedef void (*DeviceSignalHandler)(RemoteObject* object);

/// Proxy for one remote device ("org.bluez.Device").
class Device : public BluezObject {
public:
    /// A proxy for the device at path; no bus traffic.
    explicit Device(const char* path);
    virtual ~Device();

    /// A new Device for path, or null when bluetoothd is not on the bus.
    static Device* getDevice(const char* path);

    /// "DiscoverServices"(pattern): record handles to record texts, as a new Dict
    /// owned by the caller, or null (logged).
    Dict* discoverServices(const char* pattern);
    /// Sends "CancelDiscovery" without waiting; 0 when sent, else -1 (logged).
    int cancelDiscovery();

    /// Registers handler for "DisconnectRequested"; null installs the default.
    int setDisconnectRequestedHandler(DeviceSignalHandler handler);
    /// "Disconnect requested from <path>"
    static void disconnectRequestedHandler(RemoteObject* object);
};

}  // namespace Bluetooth

#endif
