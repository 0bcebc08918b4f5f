#include <bluetooth/scanner.h>

#include <memory>

#include <bluetooth/manager.h>
#include <bluetooth/util.h>

#include "core/call.h"

BT_LOG_FILE("scanner.cpp");

namespace Bluetooth {

namespace {

using internal::Op;

const Op kListDevices = { "ListDevices", internal::kWaitReply, 104 };
const Op kListDevicesQuietly = { "ListDevices", internal::kWaitReply, internal::kSilent };
const Op kRemoveFinder = { "RemoveFinder", internal::kOneWay, 150 };

// Whether BlueZ knows adapter; the service is asked only then.
bool adapterExists(const char* adapter) {
    std::unique_ptr<Manager> manager(Manager::getManager());
    if (!manager) return false;
    std::unique_ptr<Adapter> found(manager->findAdapter(adapter));
    return found != 0;
}

}  // namespace

Scanner::Scanner()
    : RemoteObject("com.quillmar.bluetooth", "/", "com.quillmar.bluetooth.Scanner",
                   DBUS_BUS_SESSION) {}

Scanner::~Scanner() {}

bool Scanner::removeFinder(const char* adapter) {
    resetError();
    if (!adapterExists(adapter)) return false;
    return internal::call(*this, kLogFile, kRemoveFinder, internal::kNoReply, adapter) == 0;
}

std::vector<std::pair<std::string, Dict*> >* Scanner::listDevices(const char* adapter,
                                                                   bool logError) {
    resetError();
    if (!adapterExists(adapter)) return 0;
    Dict reply;
    if (internal::call(*this, kLogFile, logError ? kListDevices : kListDevicesQuietly, &reply,
                       adapter) != 0)
        return 0;
    const std::string separator = ";";
    std::vector<std::pair<std::string, Dict*> >* devices =
        new std::vector<std::pair<std::string, Dict*> >;
    for (Dict::const_iterator it = reply.begin(); it != reply.end(); ++it) {
        // No separator, as in the empty text of the "no devices" entry: left out.
        Dict* properties = stringDivideToDict(variantToString(it->second), separator);
        if (properties != 0) devices->push_back(std::make_pair(it->first, properties));
    }
    return devices;
}

}  // namespace Bluetooth
