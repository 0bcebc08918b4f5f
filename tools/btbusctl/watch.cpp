// watch: every signal of bluetoothd's adapters, devices and audio profiles.
//
// The library hands a handler the proxy that registered it, not the sender,
// and calls it for a signal of the proxy's interface from any path the bus
// delivers. So one proxy per interface registers the handlers, one match rule
// makes the bus deliver every signal of org.bluez, and a filter added before
// the library's own (libdbus runs filters in the order they were added) notes
// the sender of the signal being dispatched. Devices that appear later need
// no new registration.
#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

namespace {

struct Watch {
    Output* out = 0;
    // The signal being dispatched; only the dispatching thread touches these.
    std::string path, interface, member;
    bool reported = true;
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
}

void onSignal(RemoteObject*) {
    std::unique_ptr<json> e = event();
    if (e) report(*e, (*e)["event"]);
}

const char kEveryBluezSignal[] = "type='signal',sender='org.bluez'";

}  // namespace

int watch(const Options& options) {
    blockStopSignals();  // before the receiving thread starts, so that it inherits the mask
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    DBusConnection* bus = Connection::get(DBUS_BUS_SYSTEM);
    if (bus == 0 || !dbus_connection_add_filter(bus, &noteSender, 0, 0))
        throw Failure("cannot watch the system bus");
    dbus_bus_add_match(bus, kEveryBluezSignal, 0);

    Output out(options);
    gWatch.out = &out;
    bluez->setAdapterAddedHandler(&onPath);
    bluez->setAdapterRemovedHandler(&onPath);
    bluez->setDefaultAdapterChangedHandler(&onPath);
    chosen->setDeviceCreatedHandler(&onPath);
    chosen->setDeviceRemovedHandler(&onPath);
    // Any path serves: the handlers are reached by interface and member.
    const char* anyPath = chosen->getPath();
    std::unique_ptr<Device> device(Device::getDevice(anyPath));
    std::unique_ptr<Audio> all(Audio::getAudio(anyPath));
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(anyPath));
    std::unique_ptr<Control> control(Control::getControl(anyPath));
    if (!device || !all || !sink || !control) throw Failure("bluetoothd left the system bus");
    device->setDisconnectRequestedHandler(&onSignal);
    sink->setConnectedHandler(&onSignal);
    sink->setDisconnectedHandler(&onSignal);
    sink->setPlayingHandler(&onSignal);
    sink->setStoppedHandler(&onSignal);
    control->setConnectedHandler(&onSignal);
    control->setDisconnectedHandler(&onSignal);
    for (BluezObject* proxy : std::initializer_list<BluezObject*>{bluez.get(), chosen.get(), device.get(),
                                                                   all.get(), sink.get(), control.get()})
        proxy->setPropertyChangedHandler(&onProperty);
    chosen->startLoop();
    if (options.json)
        out.print(json{{"event", "watching"}, {"path", chosen->getPath()}});
    else
        out.print("watching bluetoothd's adapters and devices (Ctrl-C stops)");
    waitForStop(std::chrono::milliseconds(0));
    chosen->stopLoop();
    chosen->waitLoop();
    dbus_bus_remove_match(bus, kEveryBluezSignal, 0);
    dbus_connection_remove_filter(bus, &noteSender, 0);
    Connection::unref(bus);
    gWatch.out = 0;
    return kOk;
}

}  // namespace btbusctl
