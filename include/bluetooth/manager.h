#ifndef BTBUS_BLUETOOTH_MANAGER_H
#define BTBUS_BLUETOOTH_MANAGER_H

#include <vector>

#include <bluetooth/adapter.h>
#include <bluetooth/bluez_object.h>
#include <bluetooth/object_path.h>

namespace Bluetooth {

/// Handler of "AdapterAdded", "AdapterRemoved" and "DefaultAdapterChanged": the
/// registering proxy and the adapter's path (valid during the call only).
typedef void (*AdapterPathHandler)(RemoteObject* object, const ObjectPath* path);

/// Adapters handed to the caller; owns them. Deleting the list deletes every
/// non-null element, front to back. Elements may be null.
class AdapterList : public std::vector<Adapter*> {
public:
    AdapterList() {}
    virtual ~AdapterList();

private:
    AdapterList(const AdapterList&) = delete;  ///< two owners would delete twice
    AdapterList& operator=(const AdapterList&) = delete;
};

/// Proxy for BlueZ's manager object ("/", "org.bluez.Manager"). Every Adapter
/// returned is new and owned by the caller.
class Manager : public BluezObject {
public:
    Manager();
    virtual ~Manager();

    /// A new Manager, or null when bluetoothd is not on the bus.
    static Manager* getManager();

    /// The adapter for "DefaultAdapter", or null (logged).
    Adapter* defaultAdapter();
    /// The adapter that "FindAdapter" finds for name (an adapter name such as
    /// "hci0", or an address), or null (logged).
    Adapter* findAdapter(const char* name);
    /// The adapter at index of "ListAdapters"; an index past the end gives the
    /// default adapter instead, on purpose. Null on failure (logged).
    Adapter* getAdapterByIndex(unsigned int index);
    /// Every adapter in reply order, as a new list; null when the call fails.
    /// Neither resets the error state nor logs. An adapter that cannot be made
    /// (bluetoothd gone midway) is kept as a null element.
    AdapterList* listAdapters();

    /// Register handlers for "AdapterAdded", "AdapterRemoved" and
    /// "DefaultAdapterChanged"; null installs the default handler below.
    ///@{
    int setAdapterAddedHandler(AdapterPathHandler handler);
    int setAdapterRemovedHandler(AdapterPathHandler handler);
    int setDefaultAdapterChangedHandler(AdapterPathHandler handler);
    ///@}

    /// bluetoothd's comings and goings: handler(this Manager, running) is
    /// called with false when bluetoothd leaves the system bus and with true
    /// when a bluetoothd takes "org.bluez" again, as after restartBluetoothd.
    /// A new daemon has new adapter paths and knows nothing of the old one's
    /// agent registrations, sessions and discoveries: redo them then. Runs on
    /// the receiving thread, like the signal handlers, until this Manager is
    /// destroyed; null installs the default handler below. 0, or -1 when the
    /// bus refuses the watch (logged).
    int setBluetoothdHandler(void (*handler)(RemoteObject* manager, bool running));
    /// "bluetoothd left the system bus" / "bluetoothd is on the system bus"
    static void bluetoothdHandler(RemoteObject* manager, bool running);

    /// "<adapter> was added by <manager path>"
    static void adapterAddedHandler(RemoteObject* object, const ObjectPath* path);
    /// "<adapter> was removed by <manager path>"
    static void adapterRemovedHandler(RemoteObject* object, const ObjectPath* path);
    /// "Default adpater is <adapter> in <manager path> now" (sic)
    static void defaultAdapterChangedHandler(RemoteObject* object, const ObjectPath* path);
};

}  // namespace Bluetooth

#endif
