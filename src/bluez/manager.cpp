#include <bluetooth/manager.h>

#include <iostream>
#include <memory>

#include "bluez/signal_line.h"
#include "core/call.h"
#include "core/owner_watch.h"

BT_LOG_FILE("manager.cpp");

namespace Bluetooth {

namespace {

using internal::Op;

const Op kDefaultAdapter = { "DefaultAdapter", internal::kWaitReply, 96 };
const Op kFindAdapter = { "FindAdapter", internal::kWaitReply, 156 };
const Op kListAdaptersByIndex = { "ListAdapters", internal::kWaitReply, 126 };

enum { kAdded, kRemoved, kDefaultChanged };
// deliberate: "adpater" is misspelt in the output.
const internal::SignalLine kSignals[] = {
    { "AdapterAdded", "", " was added by ", "" },
    { "AdapterRemoved", "", " was removed by ", "" },
    { "DefaultAdapterChanged", "Default adpater is ", " in ", " now" },
};

}  // namespace

AdapterList::~AdapterList() {
    for (iterator it = begin(); it != end(); ++it) delete *it;
}

Manager::Manager() : BluezObject("/", "org.bluez.Manager") {}

// Before this class's part is gone: a handler may look at the whole object.
Manager::~Manager() { releaseHandlers(); }

Manager* Manager::getManager() { return hasBluetoothd() ? new Manager : 0; }

Adapter* Manager::defaultAdapter() {
    ObjectPath path;
    if (internal::call(*this, kLogFile, kDefaultAdapter, &path) != 0) return 0;
    return Adapter::getAdapter(path);
}

Adapter* Manager::findAdapter(const char* name) {
    ObjectPath path;
    if (internal::call(*this, kLogFile, kFindAdapter, &path, name) != 0) return 0;
    return Adapter::getAdapter(path);
}

Adapter* Manager::getAdapterByIndex(unsigned int index) {
    std::vector<ObjectPath> paths;
    if (internal::call(*this, kLogFile, kListAdaptersByIndex, &paths) != 0) return 0;
    if (index < paths.size()) return Adapter::getAdapter(paths[index]);
    return defaultAdapter();  // deliberate: past the end falls back to the default adapter
}

AdapterList* Manager::listAdapters() {
    // By hand: this operation neither resets the error state nor logs.
    std::vector<ObjectPath> paths;
    if (newMessage("ListAdapters") != 0 || sendMessage(true, -1) != 0 ||
        getReplyValue(paths) != 0)
        return 0;
    AdapterList* adapters = new AdapterList;
    for (size_t i = 0; i < paths.size(); ++i) adapters->push_back(Adapter::getAdapter(paths[i]));
    return adapters;
}

int Manager::setAdapterAddedHandler(AdapterPathHandler handler) {
    return setSignalHandlerObjectPath(kSignals[kAdded].signal,
                                      handler != 0 ? handler : &adapterAddedHandler);
}

int Manager::setAdapterRemovedHandler(AdapterPathHandler handler) {
    return setSignalHandlerObjectPath(kSignals[kRemoved].signal,
                                      handler != 0 ? handler : &adapterRemovedHandler);
}

int Manager::setDefaultAdapterChangedHandler(AdapterPathHandler handler) {
    return setSignalHandlerObjectPath(kSignals[kDefaultChanged].signal,
                                      handler != 0 ? handler : &defaultAdapterChangedHandler);
}

int Manager::setBluetoothdHandler(void (*handler)(RemoteObject* manager, bool running)) {
    return internal::watchOwner(*this, "org.bluez", handler != 0 ? handler : &bluetoothdHandler);
}

void Manager::bluetoothdHandler(RemoteObject*, bool running) {
    std::cout << (running ? "bluetoothd is on the system bus" : "bluetoothd left the system bus") << std::endl;
}

void Manager::adapterAddedHandler(RemoteObject* object, const ObjectPath* path) {
    internal::printLine(kSignals[kAdded], path, object);
}

void Manager::adapterRemovedHandler(RemoteObject* object, const ObjectPath* path) {
    internal::printLine(kSignals[kRemoved], path, object);
}

void Manager::defaultAdapterChangedHandler(RemoteObject* object, const ObjectPath* path) {
    internal::printLine(kSignals[kDefaultChanged], path, object);
}

}  // namespace Bluetooth
