#ifndef BTBUS_BLUETOOTH_ADAPTER_H
#define BTBUS_BLUETOOTH_ADAPTER_H

#include <vector>

#include <bluetooth/agent.h>
#include <bluetooth/bluez_object.h>
#include <bluetooth/device.h>
#include <bluetooth/object_path.h>

namespace Bluetooth {

/// Handler of "DeviceFound": the registering proxy, the device's address and its
/// properties (both valid during the call only).
typedef void (*DeviceFoundHandler)(RemoteObject* object, const char* address,
                                   const Dict* properties);
/// Handler of "DeviceDisappeared": the registering proxy and the address.
typedef void (*DeviceDisappearedHandler)(RemoteObject* object, const char* address);
/// Handler of "DeviceCreated" and "DeviceRemoved": the registering proxy and the
/// device's path.
typedef void (*DevicePathHandler)(RemoteObject* object, const ObjectPath* path);

/// Devices handed to the caller; owns them. Deleting the list deletes every
/// non-null element, front to back. Elements may be null.
class DeviceList : public std::vector<Device*> {
public:
    DeviceList() {}
    virtual ~DeviceList();

private:
    DeviceList(const DeviceList&) = delete;  ///< two owners would delete twice
    DeviceList& operator=(const DeviceList&) = delete;
};

/// Proxy for one BlueZ adapter ("org.bluez.Adapter"). Operations returning 0/-1
/// send without waiting: they report only whether the request was sent, never
/// bluetoothd's refusal. Every failure is logged once. Every Device returned is
/// new and owned by the caller.
class Adapter : public BluezObject {
public:
    /// A proxy for the adapter at path; no bus traffic.
    ///@{
    explicit Adapter(const char* path);
    virtual ~Adapter();
    ///@}

    /// A new Adapter for path, or null when bluetoothd is not on the bus. The
    /// path is not checked.
    static Adapter* getAdapter(const char* path);

    /// "RequestSession", "ReleaseSession", "StartDiscovery", "StopDiscovery":
    /// sent without waiting; 0 once sent.
    ///@{
    int requestSession();
    int releaseSession();
    int startDiscovery();
    int stopDiscovery();
    ///@}

    /// The device bluetoothd knows for address, or null; a failure is logged
    /// only when logError is true.
    Device* findDevice(const char* address, bool logError);
    /// Creates the device object without pairing; the device or null.
    Device* createDevice(const char* address);
    /// Creates and pairs the device; agent (registered with registerPath) answers
    /// bluetoothd's questions meanwhile, on this thread, which dispatches the
    /// connection until the reply arrives (or SIGINT/SIGTERM). The device or null.
    Device* createPairedDevice(const char* address, const Agent& agent);
    /// "CancelDeviceCreation", "RemoveDevice", "RegisterAgent" (with the
    /// agent's path and capability) and "UnregisterAgent": sent without
    /// waiting; 0 once sent.
    ///@{
    int cancelDeviceCreation(const char* address);
    int removeDevice(const char* devicePath);
    int registerAgent(const Agent& agent);
    int unregisterAgent(const Agent& agent);
    ///@}

    /// The device at index of "ListDevices"; null past the end (no error set).
    Device* getDeviceByIndex(unsigned int index);
    /// Every device in reply order as a new list (null elements kept when a
    /// device cannot be made); null when the call fails.
    DeviceList* listDevices();

    /// The adapter's properties with "HCIVersion" appended last: the first word
    /// of the "HCI Version:" line of "/usr/bin/hciconfig <controller> -a", or ""
    /// when it prints none. Without a usable hciconfig the entry is left out.
    virtual Dict* getProperties();

    /// Register handlers of "DeviceFound", "DeviceDisappeared", "DeviceCreated"
    /// and "DeviceRemoved"; null installs the default handler below.
    ///@{
    int setDeviceFoundHandler(DeviceFoundHandler handler);
    int setDeviceDisappearedHandler(DeviceDisappearedHandler handler);
    int setDeviceCreatedHandler(DevicePathHandler handler);
    int setDeviceRemovedHandler(DevicePathHandler handler);
    ///@}

    /// "<address> was found by <adapter path>", then the properties' text form.
    static void deviceFoundHandler(RemoteObject* object, const char* address,
                                   const Dict* properties);
    /// "<address> was disappeared in <adapter path>" (sic)
    static void deviceDisappearedHandler(RemoteObject* object, const char* address);
    /// "<device path> was created by <adapter path>"
    static void deviceCreatedHandler(RemoteObject* object, const ObjectPath* path);
    /// "<device path> was removed by <adapter path>"
    static void deviceRemovedHandler(RemoteObject* object, const ObjectPath* path);
};

}  // namespace Bluetooth

#endif
