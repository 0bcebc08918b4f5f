#ifndef BTBUS_BLUETOOTH_SCANNER_SERVER_H
#define BTBUS_BLUETOOTH_SCANNER_SERVER_H

#include <map>
#include <mutex>
#include <set>
#include <string>

#include <bluetooth/manager.h>
#include <bluetooth/server_object.h>

namespace Bluetooth {

// The scanner service: one process owns Bluetooth discovery for the others.
// It answers "ListDevices" and "RemoveFinder" of "com.quillmar.bluetooth.Scanner"
// as "com.quillmar.bluetooth" at "/" on the session bus (see Scanner for the
// client). A finder, named after an adapter ("hci0"), runs discovery on it and
// holds the addresses found there; each device's properties are kept once, as
// text ("Address: 00:11:22:33:44:55;Paired: 0;"). Devices that BlueZ already
// holds as objects are left out of every answer. The loop quits by itself 30
// one-second ticks after the last finder was created.
//
// Threads. The GLib thread (the one in startLoop) runs the two methods and the
// timer; the receiving thread, started on the Manager, runs the DeviceFound and
// DeviceDisappeared callbacks. Both read and write the finder table, the
// address sets, the information map, the filter set, the founders and the
// countdown, under one lock that is never held across a bus call. Bus calls are
// made through proxies of the calling thread's own. A process has one service:
// the GObject methods and the callbacks reach the latest one constructed.

typedef std::set<std::string> AddressSet;
/// Finder name to the addresses found by it; the table owns the sets.
typedef std::map<std::string, AddressSet*> FinderTable;

/// The GObject served at "/" (type name "ScannerObject"): the GObject header and
/// the finder table. Finalising it releases the table and its sets.
struct ScannerObject {
    GObject parent;         ///< the GObject header
    FinderTable* finders;   ///< owned

    /// Starts the finder name: finds the adapter, starts discovery on it, makes
    /// it one more founder with the callbacks registered and resets the
    /// countdown to 30. Does all of that also when the finder exists, whose set
    /// then stays as it is. Returns the finder's set, or null when there is no
    /// service or BlueZ does not know the adapter.
    AddressSet* addFinder(const char* name);
    /// The set of finder name. When there is none it is created as addFinder
    /// does, once even when two threads ask for it at the same moment.
    /// The set is the service's: it changes on the receiving thread, under the
    /// service's lock, and RemoveFinder releases it.
    AddressSet* getListByName(std::string name);
};
typedef GObjectClass ScannerObjectClass;

GType scanner_object_get_type();

/// The methods as dbus-glib calls them. Errors are GErrors of domain 3, code 0:
/// "Object %s not found", "Server %s not found", "Adapter %s not found",
/// "Set %s not found" (ListDevices), "Scanner or AdapterId is null"
/// (RemoveFinder, also for an empty adapter), %s being the caller's argument.
/// ListDevices answers address to information text; an answer without devices
/// is the one entry "" to "". RemoveFinder for an adapter BlueZ does not know
/// returns false without an error.
///@{
gboolean scanner_object_list_devices(ScannerObject* object, const char* arg0, GHashTable** arg1,
                                     GError** error);
gboolean scanner_object_remove_finder(ScannerObject* object, const char* arg0, GError** error);
///@}

/// The scanner service of one process; see the header's top and the
/// scanner page of the reference.
class ScannerServer : public ServerObject {
public:
    /// Takes the session bus name, registers the object at "/", gets the
    /// Manager and reads the filter; a missing piece is logged once ("Failed to
    /// initial the ScannerServer") and construction goes on.
    ScannerServer();
    /// Deletes the Manager, each founder adapter once, the sets and the map, and
    /// releases the object. Not while startLoop runs.
    virtual ~ScannerServer();

    /// Starts the finder of adapter (a name or an address that BlueZ's
    /// "FindAdapter" accepts) with addFinder: a finder that exists gets
    /// discovery started again, one more founder and a fresh countdown. Before
    /// startLoop, or on the GLib thread.
    void addAdapterFounder(const char* adapter);
    /// Whether BlueZ held a device object for address at the last filter update.
    bool isInFilterSet(std::string& address);
    /// Rebuilds the filter from every adapter's device objects (the text after
    /// "dev_" in each path, "_" read as ":"). Without a Manager, tries to get one
    /// and logs "failed to get manager" when it cannot.
    void updateFilterSet();
    /// Replaces the information text of address.
    void putInfoToMap(std::string& address, std::string& info);
    /// The information text of address; "" (then stored) when there is none.
    std::string getInfoFromMap(std::string& address);
    /// One timer tick: counts down, quits the loop at zero and returns false.
    virtual bool callbackThreadHandler(void* data);

protected:
    ScannerObject* object;                         ///< the served GObject; one reference
    AdapterList* founders;                         ///< adapters a finder runs discovery on
    Manager* manager;                              ///< owns the receiving thread
    std::set<std::string>* filterSet;              ///< addresses BlueZ holds as devices
    std::map<std::string, std::string>* infoMap;   ///< address to information text
    int countdown;                                 ///< ticks left before the loop quits

private:
    /// The service's work behind the GObject methods and the callbacks
    /// (scanner_server.cpp).
    ///@{
    struct Service;
    friend struct Service;
    friend struct ScannerObject;
    friend class ServerObject;
    friend gboolean scanner_object_list_devices(ScannerObject*, const char*, GHashTable**,
                                                GError**);
    friend gboolean scanner_object_remove_finder(ScannerObject*, const char*, GError**);
    ///@}

    std::mutex stateLock;
    /// Adapters that RemoveFinder dropped from founders. They keep their
    /// callbacks, so a DeviceFound from that adapter creates its finder again.
    AdapterList retired;
};

}  // namespace Bluetooth

#endif
