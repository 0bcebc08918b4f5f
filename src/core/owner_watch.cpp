#include "core/owner_watch.h"

#include <list>
#include <mutex>
#include <string>
#include <vector>

#include <bluetooth/remote_object.h>

#include "core/connection_loop.h"
#include "core/dbus_holders.h"
#include "core/log.h"

BT_LOG_FILE("remote_object.cpp");

namespace Bluetooth {
namespace internal {

namespace {

struct Watch {
    RemoteObject* object;
    std::string name;
    OwnerFunction function;
};

std::mutex gWatchesLock;  // never held across a bus call or a watch's function
std::list<Watch> gWatches;

std::string ruleFor(const std::string& name) {
    return "type='signal',sender='" DBUS_SERVICE_DBUS "',interface='" DBUS_INTERFACE_DBUS
           "',member='NameOwnerChanged',arg0='" + name + "'";
}

}  // namespace

int watchOwner(RemoteObject& object, const char* name, OwnerFunction function) {
    if (name == 0 || function == 0 || object.getConnection() == 0) {
        BT_LOG_ERR("Match error (%s)", "no name, function or connection");
        return -1;
    }
    ScopedError error;
    dbus_bus_add_match(object.getConnection(), ruleFor(name).c_str(), error.get());
    if (error.isSet()) {
        BT_LOG_ERR("Match error (%s)", error.text());
        return -1;
    }
    Watch watch = { &object, name, function };
    std::lock_guard<std::mutex> hold(gWatchesLock);
    gWatches.push_back(watch);
    return 0;
}

void unwatchOwners(RemoteObject& object) {
    std::vector<std::string> rules;
    {
        std::lock_guard<std::mutex> hold(gWatchesLock);
        for (std::list<Watch>::iterator it = gWatches.begin(); it != gWatches.end();) {
            if (it->object != &object) {
                ++it;
                continue;
            }
            rules.push_back(ruleFor(it->name));
            it = gWatches.erase(it);
        }
    }
    for (size_t i = 0; i < rules.size(); ++i) {
        ScopedError error;
        dbus_bus_remove_match(object.getConnection(), rules[i].c_str(), error.get());
        if (error.isSet()) BT_LOG_ERR("Remove match error (%s)", error.text());
    }
}

void dispatchOwnerChange(DBusMessage* message) {
    if (!dbus_message_is_signal(message, DBUS_INTERFACE_DBUS, "NameOwnerChanged") ||
        !dbus_message_has_sender(message, DBUS_SERVICE_DBUS))
        return;
    const char *name = 0, *before = 0, *after = 0;
    if (!dbus_message_get_args(message, 0, DBUS_TYPE_STRING, &name, DBUS_TYPE_STRING, &before,
                               DBUS_TYPE_STRING, &after, DBUS_TYPE_INVALID))
        return;
    std::vector<Watch> matches;
    {
        std::lock_guard<std::mutex> hold(gWatchesLock);
        for (std::list<Watch>::iterator it = gWatches.begin(); it != gWatches.end(); ++it)
            if (it->name == name) {
                matches.push_back(*it);
                beginUse(it->object);  // its destruction now waits for the calls
            }
    }
    for (size_t i = 0; i < matches.size(); ++i) {
        // One whose watch ended meanwhile is not called.
        bool watched = false;
        {
            std::lock_guard<std::mutex> hold(gWatchesLock);
            for (std::list<Watch>::iterator it = gWatches.begin(); it != gWatches.end() && !watched; ++it)
                watched = it->object == matches[i].object && it->function == matches[i].function;
        }
        if (watched && *before != '\0') matches[i].function(matches[i].object, false);
        if (watched && *after != '\0') matches[i].function(matches[i].object, true);
        endUse(matches[i].object);
    }
}

}  // namespace internal
}  // namespace Bluetooth
