// watch: every signal of bluetoothd's adapters, devices and audio profiles.
//
// The library hands a handler the proxy that registered it, not the sender,
// and calls it for a signal of the proxy's interface from any path the bus
// delivers. So one proxy per interface registers the handlers, one match rule
// makes the bus deliver every signal of org.bluez, and a filter of our own
// notes the sender of each watched signal as libdbus dispatches it. The library
// runs handlers later, in the same order, on its receiving thread: the first
// noted sender of the handler's interface and member is the signal's. Devices
// that appear later need no new registration.
#include <condition_variable>
#include <deque>
#include <set>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

namespace {

struct Sent {
    std::string interface, member, path;
};

struct Watch {
    Output* out = 0;
    std::set<std::pair<std::string, std::string> > watched;  // fixed before the loop starts
    std::mutex lock;
    std::condition_variable noted;
    std::deque<Sent> sent;  // noted, not yet reported
};
Watch gWatch;

DBusHandlerResult noteSender(DBusConnection*, DBusMessage* message, void*) {
    if (dbus_message_get_type(message) != DBUS_MESSAGE_TYPE_SIGNAL) return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
    const char* interface = dbus_message_get_interface(message);
    Sent sent = {interface ? interface : "", dbus_message_get_member(message), dbus_message_get_path(message)};
    if (gWatch.watched.count(std::make_pair(sent.interface, sent.member)) != 0) {
        std::lock_guard<std::mutex> hold(gWatch.lock);
        gWatch.sent.push_back(sent);
        gWatch.noted.notify_all();
    }
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

// The sender of the signal being handled. The library's filter may queue it,
// and a receiving thread run it, just before ours has noted it: wait a little.
std::string sender(const std::string& interface, const std::string& member) {
    std::unique_lock<std::mutex> hold(gWatch.lock);
    auto match = [&] {
        for (const Sent& sent : gWatch.sent)
            if (sent.interface == interface && sent.member == member) return true;
        return false;
    };
    if (!gWatch.noted.wait_for(hold, std::chrono::seconds(1), match)) return "";
    for (;;) {
        Sent first = gWatch.sent.front();
        gWatch.sent.pop_front();
        if (first.interface == interface && first.member == member) return first.path;
    }
}

void report(json event, const std::string& detail) {
    if (gWatch.out->jsonMode()) {
        gWatch.out->print(event);
        return;
    }
    std::string interface = event["interface"];
    gWatch.out->print(shortName(event["path"]) + "  " + interface.substr(interface.rfind('.') + 1) + " " +
                      detail);
}

json event(const std::string& interface, const std::string& member) {
    return json{{"event", member}, {"interface", interface}, {"path", sender(interface, member)}};
}

void onProperty(RemoteObject* proxy, const char* name, const Variant* value) {
    json e = event(proxy->getInterface(), "PropertyChanged");
    e["name"] = name;
    e["value"] = toJson(*value);
    report(e, std::string(name) + ": " + toText(*value));
}

// Path and argument-less signals: one function per interface and member, as
// the handler cannot tell them apart otherwise.
template <const char* Interface, const char* Member>
void onPath(RemoteObject*, const ObjectPath* path) {
    json e = event(Interface, Member);
    e["object"] = path->str();
    report(e, std::string(Member) + " " + shortName(path->str()));
}

template <const char* Interface, const char* Member>
void onSignal(RemoteObject*) {
    report(event(Interface, Member), Member);
}

constexpr char kManager[] = "org.bluez.Manager", kAdapter[] = "org.bluez.Adapter",
               kDevice[] = "org.bluez.Device", kSink[] = "org.bluez.AudioSink",
               kControl[] = "org.bluez.Control";
constexpr char kAdded[] = "AdapterAdded", kRemoved[] = "AdapterRemoved",
               kDefault[] = "DefaultAdapterChanged", kCreated[] = "DeviceCreated",
               kGone[] = "DeviceRemoved", kDisconnectRequested[] = "DisconnectRequested",
               kConnected[] = "Connected", kDisconnected[] = "Disconnected", kPlaying[] = "Playing",
               kStopped[] = "Stopped";

const char kEveryBluezSignal[] = "type='signal',sender='org.bluez'";

}  // namespace

int watch(const Options& options) {
    blockStopSignals();  // before the receiving thread starts, so that it inherits the mask
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    // Any path serves: the handlers are reached by interface and member.
    const char* anyPath = chosen->getPath();
    std::unique_ptr<Device> device(Device::getDevice(anyPath));
    std::unique_ptr<Audio> all(Audio::getAudio(anyPath));
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(anyPath));
    std::unique_ptr<Control> control(Control::getControl(anyPath));
    if (!device || !all || !sink || !control) throw Failure("bluetoothd left the system bus");
    auto watched = [](const char* interface, const char* member) {
        gWatch.watched.insert(std::make_pair(interface, member));
    };
    for (const char* member : {kAdded, kRemoved, kDefault}) watched(kManager, member);
    for (const char* member : {kCreated, kGone}) watched(kAdapter, member);
    watched(kDevice, kDisconnectRequested);
    for (const char* member : {kConnected, kDisconnected, kPlaying, kStopped}) watched(kSink, member);
    for (const char* member : {kConnected, kDisconnected}) watched(kControl, member);
    const std::vector<BluezObject*> proxies = {bluez.get(), chosen.get(), device.get(),
                                               all.get(),   sink.get(),   control.get()};
    for (BluezObject* proxy : proxies) watched(proxy->getInterface(), "PropertyChanged");
    DBusConnection* bus = Connection::get(DBUS_BUS_SYSTEM);
    if (bus == 0 || !dbus_connection_add_filter(bus, &noteSender, 0, 0))
        throw Failure("cannot watch the system bus");
    dbus_bus_add_match(bus, kEveryBluezSignal, 0);

    Output out(options);
    gWatch.out = &out;
    bluez->setAdapterAddedHandler(&onPath<kManager, kAdded>);
    bluez->setAdapterRemovedHandler(&onPath<kManager, kRemoved>);
    bluez->setDefaultAdapterChangedHandler(&onPath<kManager, kDefault>);
    chosen->setDeviceCreatedHandler(&onPath<kAdapter, kCreated>);
    chosen->setDeviceRemovedHandler(&onPath<kAdapter, kGone>);
    device->setDisconnectRequestedHandler(&onSignal<kDevice, kDisconnectRequested>);
    sink->setConnectedHandler(&onSignal<kSink, kConnected>);
    sink->setDisconnectedHandler(&onSignal<kSink, kDisconnected>);
    sink->setPlayingHandler(&onSignal<kSink, kPlaying>);
    sink->setStoppedHandler(&onSignal<kSink, kStopped>);
    control->setConnectedHandler(&onSignal<kControl, kConnected>);
    control->setDisconnectedHandler(&onSignal<kControl, kDisconnected>);
    for (BluezObject* proxy : proxies) proxy->setPropertyChangedHandler(&onProperty);
    // One rule for every signal of org.bluez, whoever owns it: a new daemon's
    // adapters and devices are watched as the old one's were.
    watchRestarts(*bluez);
    chosen->startLoop();
    if (options.json)
        out.print(json{{"event", "watching"}, {"path", chosen->getPath()}});
    else
        out.print("watching bluetoothd's adapters and devices (Ctrl-C stops)");
    while (!waitForStop(std::chrono::milliseconds(100)))
        if (restarted()) reportRestart(out, *chosen, "watching its adapters and devices");
    chosen->stopLoop();
    chosen->waitLoop();
    dbus_bus_remove_match(bus, kEveryBluezSignal, 0);
    dbus_connection_remove_filter(bus, &noteSender, 0);
    Connection::unref(bus);
    gWatch.out = 0;
    return kOk;
}

}  // namespace btbusctl
