// watch: every signal of the adapter, its devices and their audio profiles.
//
// The library calls each handler once per proxy registered for the signal's
// interface and member, with the proxy rather than the sender. So a filter,
// added to the system bus before the library's own (libdbus runs filters in
// the order they were added), notes the sender of the signal being
// dispatched, and the first handler call for that signal reports it.
#include <vector>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

namespace {

struct Watch {
    Output* out = 0;
    // The signal being dispatched; only the dispatching thread touches these.
    std::string path, interface, member;
    bool reported = true;
    // Devices created meanwhile, for the main thread to watch too.
    std::mutex lock;
    std::vector<std::string> created;
};
Watch gWatch;

DBusHandlerResult noteSender(DBusConnection*, DBusMessage* message, void*) {
    if (dbus_message_get_type(message) == DBUS_MESSAGE_TYPE_SIGNAL) {
        const char* interface = dbus_message_get_interface(message);
        gWatch.path = dbus_message_get_path(message);
        gWatch.interface = interface ? interface : "";
        gWatch.member = dbus_message_get_member(message);
        gWatch.reported = false;
    }
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

// The event of the signal being dispatched, or null when already reported.
std::unique_ptr<json> event() {
    if (gWatch.reported) return nullptr;
    gWatch.reported = true;
    return std::unique_ptr<json>(new json{{"event", gWatch.member},
                                          {"interface", gWatch.interface},
                                          {"path", gWatch.path}});
}

void report(const json& event, const std::string& detail) {
    if (gWatch.out->jsonMode()) {
        gWatch.out->print(event);
        return;
    }
    std::string interface = event["interface"];
    interface = interface.substr(interface.rfind('.') + 1);
    std::string line = shortName(event["path"]) + "  " + interface + " " + detail;
    gWatch.out->print(line);
}

void onProperty(RemoteObject*, const char* name, const Variant* value) {
    std::unique_ptr<json> e = event();
    if (!e) return;
    (*e)["name"] = name;
    (*e)["value"] = toJson(*value);
    report(*e, std::string(name) + ": " + toText(*value));
}

void onPath(RemoteObject*, const ObjectPath* path) {
    std::unique_ptr<json> e = event();
    if (!e) return;
    (*e)["object"] = path->str();
    report(*e, (*e)["event"].get<std::string>() + " " + shortName(path->str()));
    if ((*e)["event"] == "DeviceCreated") {
        std::lock_guard<std::mutex> hold(gWatch.lock);
        gWatch.created.push_back(path->str());
    }
}

void onSignal(RemoteObject*) {
    std::unique_ptr<json> e = event();
    if (e) report(*e, (*e)["event"]);
}

// The proxies of one device whose signals are watched.
void watchDevice(const std::string& path, std::vector<std::unique_ptr<BluezObject> >& proxies) {
    std::unique_ptr<Device> device(Device::getDevice(path.c_str()));
    std::unique_ptr<Audio> all(Audio::getAudio(path.c_str()));
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(path.c_str()));
    std::unique_ptr<Control> control(Control::getControl(path.c_str()));
    if (!device || !all || !sink || !control) return;  // bluetoothd left
    device->setDisconnectRequestedHandler(&onSignal);
    sink->setConnectedHandler(&onSignal);
    sink->setDisconnectedHandler(&onSignal);
    sink->setPlayingHandler(&onSignal);
    sink->setStoppedHandler(&onSignal);
    control->setConnectedHandler(&onSignal);
    control->setDisconnectedHandler(&onSignal);
    proxies.emplace_back(device.release());
    proxies.emplace_back(all.release());
    proxies.emplace_back(sink.release());
    proxies.emplace_back(control.release());
    for (size_t i = proxies.size() - 4; i < proxies.size(); ++i)
        proxies[i]->setPropertyChangedHandler(&onProperty);
}

}  // namespace

int watch(const Options& options) {
    blockStopSignals();  // before the receiving thread starts, so that it inherits the mask
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    DBusConnection* bus = Connection::get(DBUS_BUS_SYSTEM);
    if (bus == 0 || !dbus_connection_add_filter(bus, &noteSender, 0, 0))
        throw Failure("cannot watch the system bus");

    Output out(options);
    gWatch.out = &out;
    bluez->setAdapterAddedHandler(&onPath);
    bluez->setAdapterRemovedHandler(&onPath);
    bluez->setDefaultAdapterChangedHandler(&onPath);
    chosen->setPropertyChangedHandler(&onProperty);
    chosen->setDeviceCreatedHandler(&onPath);
    chosen->setDeviceRemovedHandler(&onPath);
    std::vector<std::unique_ptr<BluezObject> > proxies;
    std::unique_ptr<DeviceList> devices(chosen->listDevices());
    for (size_t i = 0; devices && i < devices->size(); ++i)
        if ((*devices)[i]) watchDevice((*devices)[i]->getPath(), proxies);
    chosen->startLoop();
    if (!options.json)
        out.print("watching " + shortName(chosen->getPath()) + " and its devices (Ctrl-C stops)");

    while (!waitForStop(std::chrono::milliseconds(200))) {
        std::vector<std::string> created;
        {
            std::lock_guard<std::mutex> hold(gWatch.lock);
            created.swap(gWatch.created);
        }
        for (const std::string& path : created) watchDevice(path, proxies);
    }
    chosen->stopLoop();
    chosen->waitLoop();
    dbus_connection_remove_filter(bus, &noteSender, 0);
    Connection::unref(bus);
    gWatch.out = 0;
    return kOk;
}

}  // namespace btbusctl
