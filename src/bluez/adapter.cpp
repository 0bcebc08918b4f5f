#include <bluetooth/adapter.h>

#include <cstdio>
#include <string>

#include <bluetooth/util.h>

#include "bluez/signal_line.h"
#include "core/call.h"
#include "util/process.h"

BT_LOG_FILE("adapter.cpp");

namespace Bluetooth {

namespace {

using internal::Op;
using internal::kNoReply;

const Op kRequestSession = { "RequestSession", internal::kOneWay, 83 };
const Op kReleaseSession = { "ReleaseSession", internal::kOneWay, 105 };
const Op kStartDiscovery = { "StartDiscovery", internal::kOneWay, 127 };
const Op kStopDiscovery = { "StopDiscovery", internal::kOneWay, 149 };
const char kFindDevice[] = "FindDevice";
const int kFindDeviceLogLine = 180;
const Op kListDevices = { "ListDevices", internal::kWaitReply, 212 };
const Op kListDevicesByIndex = { "ListDevices", internal::kWaitReply, 243 };
const Op kCreateDevice = { "CreateDevice", internal::kWaitReply, 274 };
const Op kCreatePairedDevice = { "CreatePairedDevice", internal::kPending, 312 };
const Op kCancelDeviceCreation = { "CancelDeviceCreation", internal::kOneWay, 337 };
const Op kRemoveDevice = { "RemoveDevice", internal::kOneWay, 363 };
const Op kRegisterAgent = { "RegisterAgent", internal::kOneWay, 393 };
const Op kUnregisterAgent = { "UnregisterAgent", internal::kOneWay, 419 };
const int kHciconfigLogLine = 438;

enum { kFound, kDisappeared, kCreated, kRemoved };
// deliberate: " was disappeared in " is the required wording.
const internal::SignalLine kSignals[] = {
    { "DeviceFound", "", " was found by ", "\n" },
    { "DeviceDisappeared", "", " was disappeared in ", "" },
    { "DeviceCreated", "", " was created by ", "" },
    { "DeviceRemoved", "", " was removed by ", "" },
};

const char kHciconfig[] = "/usr/bin/hciconfig";
const char kHciVersionKey[] = "HCIVersion";

// The last component of an object path: the controller's name ("hci0").
std::string controllerName(const std::string& path) {
    std::string::size_type slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

}  // namespace

DeviceList::~DeviceList() {
    for (iterator it = begin(); it != end(); ++it) delete *it;
}

Adapter::Adapter(const char* path) : BluezObject(path, "org.bluez.Adapter") {}

// Before this class's part is gone: a handler may look at the whole object.
Adapter::~Adapter() { releaseHandlers(); }

Adapter* Adapter::getAdapter(const char* path) { return hasBluetoothd() ? new Adapter(path) : 0; }

int Adapter::requestSession() { return internal::call(*this, kLogFile, kRequestSession, kNoReply); }

int Adapter::releaseSession() { return internal::call(*this, kLogFile, kReleaseSession, kNoReply); }

int Adapter::startDiscovery() { return internal::call(*this, kLogFile, kStartDiscovery, kNoReply); }

int Adapter::stopDiscovery() { return internal::call(*this, kLogFile, kStopDiscovery, kNoReply); }

Device* Adapter::findDevice(const char* address, bool logError) {
    const Op op = { kFindDevice, internal::kWaitReply, logError ? kFindDeviceLogLine : internal::kSilent };
    ObjectPath path;
    if (internal::call(*this, kLogFile, op, &path, address) != 0) return 0;
    return Device::getDevice(path);
}

Device* Adapter::createDevice(const char* address) {
    ObjectPath path;
    if (internal::call(*this, kLogFile, kCreateDevice, &path, address) != 0) return 0;
    return Device::getDevice(path);
}

Device* Adapter::createPairedDevice(const char* address, const Agent& agent) {
    ObjectPath path;
    if (internal::call(*this, kLogFile, kCreatePairedDevice, &path, address,
                       ObjectPath(agent.getPath()), agent.getCapability()) != 0)
        return 0;
    return Device::getDevice(path);
}

int Adapter::cancelDeviceCreation(const char* address) {
    return internal::call(*this, kLogFile, kCancelDeviceCreation, kNoReply, address);
}

int Adapter::removeDevice(const char* devicePath) {
    return internal::call(*this, kLogFile, kRemoveDevice, kNoReply, internal::PathText(devicePath));
}

int Adapter::registerAgent(const Agent& agent) {
    return internal::call(*this, kLogFile, kRegisterAgent, kNoReply, ObjectPath(agent.getPath()),
                          agent.getCapability());
}

int Adapter::unregisterAgent(const Agent& agent) {
    return internal::call(*this, kLogFile, kUnregisterAgent, kNoReply,
                          ObjectPath(agent.getPath()));
}

Device* Adapter::getDeviceByIndex(unsigned int index) {
    std::vector<ObjectPath> paths;
    if (internal::call(*this, kLogFile, kListDevicesByIndex, &paths) != 0) return 0;
    return index < paths.size() ? Device::getDevice(paths[index]) : 0;  // no fallback here
}

DeviceList* Adapter::listDevices() {
    std::vector<ObjectPath> paths;
    if (internal::call(*this, kLogFile, kListDevices, &paths) != 0) return 0;
    DeviceList* devices = new DeviceList;
    for (size_t i = 0; i < paths.size(); ++i) devices->push_back(Device::getDevice(paths[i]));
    return devices;
}

Dict* Adapter::getProperties() {
    Dict* properties = BluezObject::getProperties();
    if (properties == 0) return 0;
    std::string controller = controllerName(path);
    const char* const argv[] = { kHciconfig, controller.c_str(), "-a", 0 };
    // Once the version is read, a hciconfig that hangs is killed after a grace period.
    internal::Process command(kHciconfig, argv, true);
    if (command.output() == 0) {
        internal::logError(kLogFile, kHciconfigLogLine, "Failed to get open(%s %s)", kHciconfig,
                           controller.c_str());
        return properties;
    }
    Entry version(kHciVersionKey, std::string());
    char line[1024];
    char token[1024];
    while (fgets(line, sizeof line, command.output()) != 0) {
        if (sscanf(line, "\tHCI Version: %1023s", token) == 1) {
            version.second = std::string(token);  // only the first word is kept
            break;
        }
    }
    properties->push_back(version);
    return properties;
}

int Adapter::setDeviceFoundHandler(DeviceFoundHandler handler) {
    return setSignalHandlerStringDict(kSignals[kFound].signal,
                                      handler != 0 ? handler : &deviceFoundHandler);
}

int Adapter::setDeviceDisappearedHandler(DeviceDisappearedHandler handler) {
    return setSignalHandlerString(kSignals[kDisappeared].signal,
                                  handler != 0 ? handler : &deviceDisappearedHandler);
}

int Adapter::setDeviceCreatedHandler(DevicePathHandler handler) {
    return setSignalHandlerObjectPath(kSignals[kCreated].signal,
                                      handler != 0 ? handler : &deviceCreatedHandler);
}

int Adapter::setDeviceRemovedHandler(DevicePathHandler handler) {
    return setSignalHandlerObjectPath(kSignals[kRemoved].signal,
                                      handler != 0 ? handler : &deviceRemovedHandler);
}

void Adapter::deviceFoundHandler(RemoteObject* object, const char* address,
                                 const Dict* properties) {
    std::string text;
    if (properties != 0) text = dictToString(*properties);
    internal::printLine(kSignals[kFound], address, object, properties != 0 ? text.c_str() : 0);
}

void Adapter::deviceDisappearedHandler(RemoteObject* object, const char* address) {
    internal::printLine(kSignals[kDisappeared], address, object);
}

void Adapter::deviceCreatedHandler(RemoteObject* object, const ObjectPath* path) {
    internal::printLine(kSignals[kCreated], path, object);
}

void Adapter::deviceRemovedHandler(RemoteObject* object, const ObjectPath* path) {
    internal::printLine(kSignals[kRemoved], path, object);
}

}  // namespace Bluetooth
