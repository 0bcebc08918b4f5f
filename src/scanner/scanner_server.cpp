#include <bluetooth/scanner_server.h>

#include <atomic>
#include <cstring>
#include <memory>

#include <bluetooth/util.h>

#include "core/log.h"
#include "scanner/guarded.h"

BT_LOG_FILE("scanner_server.cpp");

namespace Bluetooth {

namespace {

const int kInitialLogLine = 224;
const int kNoManagerLogLine = 262;
const int kIdleTicks = 30;
// Errors carry the number 3 as their domain: no domain is registered for them.
const GQuark kErrorDomain = 3;
const char kSeparator[] = ";";

// The service that the GObject methods and the callbacks reach.
std::atomic<ScannerServer*> gServer(0);

// The text after the last "/" of path: the finder's name ("hci0").
std::string adapterNameFromPath(const char* path) {
    if (path == 0) return "";
    const char* slash = strrchr(path, '/');
    return slash != 0 ? std::string(slash + 1) : std::string();
}

void fail(GError** error, const char* format, const char* argument) {
    g_set_error(error, kErrorDomain, 0, format, argument != 0 ? argument : "");
}

}  // namespace

// Every step that reads or writes shared state takes the server's lock and
// lets it go before any bus call. Bus calls use a Manager of the caller's own:
// the server's Manager is the receiving thread's dispatching object, whose
// error state that thread writes.
struct __attribute__((visibility("hidden"))) ScannerServer::Service {
    typedef std::lock_guard<std::mutex> Hold;

    static ScannerServer* current() { return gServer.load(); }

    static Adapter* findAdapter(ScannerServer& server, const char* name) {
        if (server.manager == 0) return 0;
        Manager bluez;
        return bluez.findAdapter(name);
    }

    // Starts discovery on the adapter of finder name with the callbacks
    // registered, and makes it a founder; null when BlueZ does not know it.
    static Adapter* startFounder(ScannerServer& server, const char* name) {
        Adapter* adapter = findAdapter(server, name);
        if (adapter != 0) discover(*adapter);
        return adapter;
    }

    static void discover(Adapter& adapter) {
        adapter.startDiscovery();
        adapter.setDeviceFoundHandler(&scannerDeviceFound);
        adapter.setDeviceDisappearedHandler(&scannerDeviceDisappeared);
    }

    static void addFounderLocked(ScannerServer& server, Adapter* adapter) {
        server.founders->push_back(adapter);
        server.countdown = kIdleTicks;
    }

    // A deliberate addFinder: discovery starts again, the adapter becomes one
    // more founder and the countdown starts again, also when the finder
    // exists, which then keeps its set.
    static AddressSet* addFinder(ScannerObject& object, ScannerServer& server, const char* name) {
        Adapter* adapter = startFounder(server, name);
        if (adapter == 0) return 0;
        Hold hold(server.stateLock);
        addFounderLocked(server, adapter);
        AddressSet*& set = (*object.finders)[name];
        if (set == 0) set = new AddressSet;
        return set;
    }

    // A finder that a ListDevices and a DeviceFound may both need at once: the
    // first claims its set before the bus calls, so discovery starts once.
    // The set returned only tells whether there is one; read it under the lock.
    static AddressSet* finder(ScannerObject& object, ScannerServer& server, const std::string& name) {
        AddressSet* claimed = 0;
        {
            Hold hold(server.stateLock);
            if (AddressSet* set = finderLocked(object, name)) return set;
            claimed = new AddressSet;
            (*object.finders)[name] = claimed;
        }
        Adapter* adapter = startFounder(server, name.c_str());
        Hold hold(server.stateLock);
        if (adapter == 0) {
            FinderTable::iterator found = object.finders->find(name);
            if (found != object.finders->end() && found->second == claimed) {
                object.finders->erase(found);
                delete claimed;
            }
            return 0;
        }
        addFounderLocked(server, adapter);
        return finderLocked(object, name);
    }

    static AddressSet* finderLocked(ScannerObject& object, const std::string& name) {
        FinderTable::iterator found = object.finders->find(name);
        return found != object.finders->end() ? found->second : 0;
    }

    static void putInfoLocked(ScannerServer& server, const std::string& address,
                              const std::string& info) {
        if (server.infoMap != 0) (*server.infoMap)[address] = info;
    }

    // The finder of the adapter whose callback runs; created again when
    // RemoveFinder dropped it.
    static ScannerServer* finderFor(RemoteObject* object, std::string& name) {
        ScannerServer* server = current();
        if (object == 0 || dynamic_cast<Adapter*>(object) == 0 || server == 0 ||
            server->object == 0)
            return 0;
        name = adapterNameFromPath(object->getPath());
        server->object->getListByName(name);
        return server;
    }

    // The DeviceFound and DeviceDisappeared callbacks, on the receiving thread.
    static void scannerDeviceFound(RemoteObject* object, const char* address,
                                   const Dict* properties) {
        internal::guarded(kLogFile, __LINE__, "DeviceFound",
                          [&] { deviceFound(object, address, properties); });
    }

    static void scannerDeviceDisappeared(RemoteObject* object, const char* address) {
        internal::guarded(kLogFile, __LINE__, "DeviceDisappeared",
                          [&] { deviceDisappeared(object, address); });
    }

    static void deviceFound(RemoteObject* object, const char* address, const Dict* properties) {
        std::string name;
        ScannerServer* server = finderFor(object, name);
        // An empty address is no device, and an empty key would end a client's
        // decoding of the answer.
        if (server == 0 || address == 0 || *address == '\0' || properties == 0) return;
        std::string separator = kSeparator;
        std::string info = dictConquerToString(*properties, separator);
        Hold hold(server->stateLock);
        putInfoLocked(*server, address, info);
        AddressSet* set = finderLocked(*server->object, name);
        if (set != 0) set->insert(address);
    }

    static void deviceDisappeared(RemoteObject* object, const char* address) {
        std::string name;
        ScannerServer* server = finderFor(object, name);
        if (server == 0 || address == 0) return;
        Hold hold(server->stateLock);
        AddressSet* set = finderLocked(*server->object, name);
        if (set != 0) set->erase(address);
    }

    // Discovery again on an adapter that BlueZ has anew, for a finder that
    // wants it; no new countdown, as no finder was created.
    // Runs on the receiving thread only, so two never start the same.
    static void restartFinder(ScannerServer& server, const std::string& name) {
        {
            Hold hold(server.stateLock);
            if (finderLocked(*server.object, name) == 0) return;
        }
        // None: it is gone, and its finder stays empty until it returns.
        std::unique_ptr<Adapter> adapter(findAdapter(server, name.c_str()));
        if (!adapter) return;
        {
            // The new daemon announces its adapters as it comes up.
            Hold hold(server.stateLock);
            for (size_t i = 0; i < server.founders->size(); ++i)
                if ((*server.founders)[i] != 0 && strcmp((*server.founders)[i]->getPath(), adapter->getPath()) == 0)
                    return;
        }
        discover(*adapter);
        Hold hold(server.stateLock);
        server.founders->push_back(adapter.release());
    }

    // The adapters of path (all, when null) are gone, and with them what they
    // found: a daemon that is gone can no longer report it disappeared. The
    // information texts stay.
    static void dropFounders(ScannerServer& server, const char* path) {
        AdapterList gone;
        {
            Hold hold(server.stateLock);
            for (AdapterList* list : { server.founders, &server.retired }) {
                for (AdapterList::iterator it = list->begin(); it != list->end();) {
                    if (*it != 0 && path != 0 && strcmp((*it)->getPath(), path) != 0) {
                        ++it;
                        continue;
                    }
                    gone.push_back(*it);
                    it = list->erase(it);
                }
            }
            for (FinderTable::iterator it = server.object->finders->begin(); it != server.object->finders->end(); ++it)
                if (path == 0 || it->first == adapterNameFromPath(path)) it->second->clear();
        }
    }  // gone deletes the proxies, and their callbacks with them

    // bluetoothd left or came back (a restart: new adapter paths): every
    // finder starts over on the new daemon's adapter of the same name.
    static void bluetoothdChanged(RemoteObject*, bool running) {
        internal::guarded(kLogFile, __LINE__, "bluetoothd's restart", [running] {
            ScannerServer* server = current();
            if (server == 0 || server->object == 0) return;
            dropFounders(*server, 0);
            if (!running) return;
            std::vector<std::string> names;
            {
                Hold hold(server->stateLock);
                for (FinderTable::iterator it = server->object->finders->begin();
                     it != server->object->finders->end(); ++it)
                    names.push_back(it->first);
            }
            for (size_t i = 0; i < names.size(); ++i) restartFinder(*server, names[i]);
        });
    }

    static void adapterAdded(RemoteObject*, const ObjectPath* path) {
        internal::guarded(kLogFile, __LINE__, "AdapterAdded", [path] {
            ScannerServer* server = current();
            if (server != 0 && server->object != 0 && path != 0)
                restartFinder(*server, adapterNameFromPath(path->c_str()));
        });
    }

    static void adapterRemoved(RemoteObject*, const ObjectPath* path) {
        internal::guarded(kLogFile, __LINE__, "AdapterRemoved", [path] {
            ScannerServer* server = current();
            if (server != 0 && server->object != 0 && path != 0) dropFounders(*server, path->c_str());
        });
    }

    static gboolean listDevices(ScannerObject* object, const char* arg0, GHashTable** arg1,
                                GError** error) {
        if (object == 0) {
            fail(error, "Object %s not found", arg0);
            return FALSE;
        }
        ScannerServer* server = current();
        if (server == 0) {
            fail(error, "Server %s not found", arg0);
            return FALSE;
        }
        std::unique_ptr<Adapter> adapter(findAdapter(*server, arg0));
        if (!adapter) {
            fail(error, "Adapter %s not found", arg0);
            return FALSE;
        }
        std::string name = adapterNameFromPath(adapter->getPath());
        if (object->getListByName(name) == 0) {
            fail(error, "Set %s not found", arg0);
            return FALSE;
        }
        server->updateFilterSet();
        GHashTable* answer = g_hash_table_new_full(g_str_hash, g_str_equal, g_free, g_free);
        {
            Hold hold(server->stateLock);
            AddressSet* set = finderLocked(*object, name);
            if (set != 0) {
                for (AddressSet::const_iterator it = set->begin(); it != set->end(); ++it) {
                    if (server->filterSet != 0 && server->filterSet->count(*it) != 0) continue;
                    std::string& info = (*server->infoMap)[*it];
                    g_hash_table_insert(answer, g_strdup(it->c_str()), g_strdup(info.c_str()));
                }
            }
        }
        // Never an empty dictionary: no devices is the one entry "" to "".
        if (g_hash_table_size(answer) == 0) g_hash_table_insert(answer, g_strdup(""), g_strdup(""));
        *arg1 = answer;
        return TRUE;
    }

    static gboolean removeFinder(ScannerObject* object, const char* arg0, GError** error) {
        ScannerServer* server = current();
        if (object == 0 || arg0 == 0 || *arg0 == '\0') {
            fail(error, "Scanner or AdapterId is null", arg0);
            return FALSE;
        }
        if (server == 0) {
            fail(error, "Server %s not found", arg0);
            return FALSE;
        }
        std::unique_ptr<Adapter> adapter(findAdapter(*server, arg0));
        if (!adapter) return FALSE;  // deliberate: no error text for an unknown adapter
        bool stop = false;
        AddressSet* dropped = 0;
        {
            Hold hold(server->stateLock);
            AdapterList& founders = *server->founders;
            for (AdapterList::iterator it = founders.begin(); it != founders.end(); ++it) {
                if (*it == 0 || strcmp((*it)->getPath(), adapter->getPath()) != 0) continue;
                server->retired.push_back(*it);
                founders.erase(it);
                stop = true;
                break;
            }
            FinderTable::iterator found = object->finders->find(adapterNameFromPath(adapter->getPath()));
            if (found != object->finders->end()) {
                dropped = found->second;
                object->finders->erase(found);
            }
        }
        delete dropped;
        if (stop) adapter->stopDiscovery();
        return TRUE;
    }
};

namespace {

// The bindings' call of a method: an exception becomes a failure with its text.
template <typename Method>
gboolean answer(const char* what, GError** error, Method method) {
    gboolean result = FALSE;
    bool done = internal::guarded(kLogFile, __LINE__, what, [&] { result = method(); });
    if (!done && (error == 0 || *error == 0)) fail(error, "%s failed", what);
    return result;
}

}  // namespace

gboolean scanner_object_list_devices(ScannerObject* object, const char* arg0, GHashTable** arg1,
                                     GError** error) {
    return answer("ListDevices", error,
                  [&] { return ScannerServer::Service::listDevices(object, arg0, arg1, error); });
}

gboolean scanner_object_remove_finder(ScannerObject* object, const char* arg0, GError** error) {
    return answer("RemoveFinder", error,
                  [&] { return ScannerServer::Service::removeFinder(object, arg0, error); });
}

}  // namespace Bluetooth

// The object information and marshallers, generated from scanner_object.xml by
// dbus-binding-tool; they name the two method functions unqualified.
using Bluetooth::scanner_object_list_devices;
using Bluetooth::scanner_object_remove_finder;
#include "scanner_object_glue.h"

namespace Bluetooth {

namespace {

gpointer gParentClass = 0;

void scannerObjectFinalize(GObject* instance) {
    ScannerObject* object = reinterpret_cast<ScannerObject*>(instance);
    for (FinderTable::iterator it = object->finders->begin(); it != object->finders->end(); ++it)
        delete it->second;
    delete object->finders;
    object->finders = 0;
    G_OBJECT_CLASS(gParentClass)->finalize(instance);
}

void scannerObjectClassInit(gpointer klass, gpointer) {
    gParentClass = g_type_class_peek_parent(klass);
    G_OBJECT_CLASS(klass)->finalize = &scannerObjectFinalize;
}

void scannerObjectInit(GTypeInstance* instance, gpointer) {
    reinterpret_cast<ScannerObject*>(instance)->finders = new FinderTable;
}

}  // namespace

GType scanner_object_get_type() {
    static gsize type = 0;
    if (g_once_init_enter(&type)) {
        GType registered = g_type_register_static_simple(
            G_TYPE_OBJECT, g_intern_static_string("ScannerObject"), sizeof(ScannerObjectClass),
            &scannerObjectClassInit, sizeof(ScannerObject), &scannerObjectInit, GTypeFlags(0));
        g_once_init_leave(&type, registered);
    }
    return type;
}

AddressSet* ScannerObject::addFinder(const char* name) {
    ScannerServer* server = ScannerServer::Service::current();
    if (server == 0 || name == 0) return 0;
    return ScannerServer::Service::addFinder(*this, *server, name);
}

AddressSet* ScannerObject::getListByName(std::string name) {
    ScannerServer* server = ScannerServer::Service::current();
    if (server == 0) return 0;
    return ScannerServer::Service::finder(*this, *server, name);
}

// ---- ScannerServer ----

ScannerServer::ScannerServer()
    : ServerObject("com.quillmar.bluetooth", "/", DBUS_BUS_SESSION),
      object(0),
      founders(0),
      manager(0),
      filterSet(0),
      infoMap(0),
      countdown(kIdleTicks) {
    object = static_cast<ScannerObject*>(g_object_new(scanner_object_get_type(), NULL));
    manager = Manager::getManager();
    founders = new AdapterList;
    filterSet = new std::set<std::string>;
    infoMap = new std::map<std::string, std::string>;
    bool prepared = prepareObjectInfo(scanner_object_get_type(),
                                      &dbus_glib_scanner_object_object_info, G_OBJECT(object));
    if (object == 0 || manager == 0 || !prepared)
        internal::logError(kLogFile, kInitialLogLine, "Failed to initial the ScannerServer");
    updateFilterSet();
    // A new bluetoothd, or an adapter that comes and goes, restarts the finders.
    if (manager != 0) {
        manager->setBluetoothdHandler(&Service::bluetoothdChanged);
        manager->setAdapterAddedHandler(&Service::adapterAdded);
        manager->setAdapterRemovedHandler(&Service::adapterRemoved);
    }
    gServer.store(this);
}

ScannerServer::~ScannerServer() {
    // Nothing reaches this object any more.
    ScannerServer* self = this;
    gServer.compare_exchange_strong(self, 0);
    delete manager;
    delete founders;  // deletes each adapter once
    delete filterSet;
    delete infoMap;
    if (object != 0) g_object_unref(object);
}

void ScannerServer::addAdapterFounder(const char* adapter) {
    if (object == 0) return;
    std::unique_ptr<Adapter> found(Service::findAdapter(*this, adapter));
    if (found) object->addFinder(adapterNameFromPath(found->getPath()).c_str());
}

bool ScannerServer::isInFilterSet(std::string& address) {
    Service::Hold hold(stateLock);
    return filterSet != 0 && filterSet->count(address) != 0;
}

void ScannerServer::updateFilterSet() {
    if (manager == 0) {
        // Only the constructor can get here before the loop runs.
        manager = Manager::getManager();
        if (manager == 0) {
            internal::logError(kLogFile, kNoManagerLogLine, "failed to get manager");
            return;
        }
    }
    std::set<std::string> held;
    Manager bluez;
    std::unique_ptr<AdapterList> adapters(bluez.listAdapters());
    for (size_t i = 0; adapters && i < adapters->size(); ++i) {
        if ((*adapters)[i] == 0) continue;
        std::unique_ptr<DeviceList> devices((*adapters)[i]->listDevices());
        for (size_t j = 0; devices && j < devices->size(); ++j) {
            if ((*devices)[j] == 0) continue;
            std::string path = (*devices)[j]->getPath();
            std::string::size_type dev = path.find("dev_");
            if (dev == std::string::npos) continue;
            std::string address = path.substr(dev + 4);
            for (size_t k = 0; k < address.size(); ++k)
                if (address[k] == '_') address[k] = ':';
            if (!address.empty()) held.insert(address);
        }
    }
    Service::Hold hold(stateLock);
    if (filterSet == 0) filterSet = new std::set<std::string>;
    filterSet->swap(held);
}

void ScannerServer::putInfoToMap(std::string& address, std::string& info) {
    Service::Hold hold(stateLock);
    Service::putInfoLocked(*this, address, info);
}

std::string ScannerServer::getInfoFromMap(std::string& address) {
    Service::Hold hold(stateLock);
    return infoMap != 0 ? (*infoMap)[address] : std::string();
}

bool ScannerServer::callbackThreadHandler(void*) {
    {
        Service::Hold hold(stateLock);
        if (--countdown != 0) return true;
    }
    quitLoop();
    return false;
}

}  // namespace Bluetooth
