// devices, info, create, services, remove, audio, volume.
#include <cstdio>
#include <cstdlib>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

namespace {

std::string flags(const Dict& props) {
    std::string text;
    for (const char* flag : {"Paired", "Trusted", "Connected", "Blocked"}) {
        const Variant* on = lookup(props, flag);
        if (on && variantToBool(*on)) text += std::string(text.empty() ? "" : ", ") + flag;
    }
    return text;
}

json withPath(const Dict& props, const std::string& path) {
    json object = toJson(props);
    object["Path"] = path;
    return object;
}

}  // namespace

int listDevices(const Options& options) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::unique_ptr<DeviceList> all(chosen->listDevices());
    if (!all) throw failed("ListDevices", *chosen);
    json list = json::array();
    std::string text;
    for (Device* device : *all) {
        if (device == 0) continue;
        Dict props = properties(*device);
        list.push_back(withPath(props, device->getPath()));
        text += (text.empty() ? "" : "\n") + find(&props, "Address") + "  " + find(&props, "Alias");
        std::string state = flags(props);
        if (!state.empty()) text += "  (" + state + ")";
    }
    Output out(options);
    if (options.json)
        out.print(list);
    else
        out.print(text.empty() ? "no devices on " + shortName(chosen->getPath()) : text);
    return kOk;
}

int deviceInfo(const Options& options, const std::string& address) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::unique_ptr<Device> device = knownDevice(*chosen, address);
    Dict props = properties(*device);
    Output out(options);
    if (options.json)
        out.print(withPath(props, device->getPath()));
    else
        out.print(find(&props, "Address") + " (" + device->getPath() + ")\n" + dictText(props));
    return kOk;
}

int createDevice(const Options& options, const std::string& address) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::unique_ptr<Device> device(chosen->createDevice(address.c_str()));
    if (!device) throw failed("creating " + address, *chosen);
    Output out(options);
    if (options.json)
        out.print(json{{"address", address}, {"path", device->getPath()}});
    else
        out.print("created " + address + " at " + device->getPath());
    return kOk;
}

namespace {

// The value of the first `marker value="..."` after the attribute `id` of a
// service record, or "".
std::string recordValue(const std::string& xml, const char* id, const char* marker) {
    size_t at = xml.find(std::string("id=\"") + id + "\"");
    if (at == std::string::npos) return "";
    at = xml.find(std::string("<") + marker + " value=\"", at);
    if (at == std::string::npos) return "";
    at = xml.find('"', at) + 1;
    return xml.substr(at, xml.find('"', at) - at);
}

}  // namespace

int services(const Options& options, const std::string& address, const std::string& pattern) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::unique_ptr<Device> device = knownDevice(*chosen, address);
    std::unique_ptr<Dict> records(device->discoverServices(pattern.c_str()));
    if (!records) throw failed("service discovery on " + address, *device);
    Output out(options);
    if (options.json) {
        json found = json::object();
        for (const Entry& record : *records) found[record.first] = variantToString(record.second);
        out.print(json{{"address", address}, {"records", found}});
        return kOk;
    }
    std::string text;
    for (const Entry& record : *records) {
        std::string xml = variantToString(record.second);
        char handle[16];
        snprintf(handle, sizeof handle, "0x%05lx", std::strtoul(record.first.c_str(), 0, 10));
        text += std::string(text.empty() ? "" : "\n") + handle + "  " +
                recordValue(xml, "0x0001", "uuid") + "  " + recordValue(xml, "0x0100", "text");
    }
    out.print(text.empty() ? "no service records on " + address : text);
    return kOk;
}

int removeDevice(const Options& options, const std::string& address) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::string path = knownDevice(*chosen, address)->getPath();
    if (chosen->removeDevice(path.c_str()) != 0) throw failed("RemoveDevice", *chosen);
    // Sent without waiting (a connected device is disconnected first): look again.
    bool gone = waitUntil([&] { return std::unique_ptr<Device>(chosen->findDevice(address.c_str(), false)) == 0; },
                          std::chrono::seconds(5));
    if (!gone) throw Failure("bluetoothd did not remove " + address);
    Output out(options);
    if (options.json)
        out.print(json{{"address", address}, {"removed", true}});
    else
        out.print("removed " + address);
    return kOk;
}

namespace {

std::string state(BluezObject& object) {
    Dict props = properties(object);
    return find(&props, "State");
}

// Owns what a proxy factory made; null means bluetoothd left meanwhile.
template <typename Proxy>
std::unique_ptr<Proxy> made(Proxy* proxy) {
    if (proxy == 0) throw Failure("bluetoothd is not running on the system bus");
    return std::unique_ptr<Proxy>(proxy);
}

}  // namespace

int audio(const Options& options, const std::string& action, const std::string& address) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::unique_ptr<Device> device = knownDevice(*chosen, address);
    std::unique_ptr<Audio> all = made(Audio::getAudio(device->getPath()));
    std::string before;
    try {
        before = state(*all);
    } catch (const Failure& e) {
        throw Failure(address + " has no audio profile (" + e.what() + ")");
    }
    Output out(options);
    if (action == "status") {
        json status = {{"address", address}, {"state", before}};
        std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(device->getPath()));
        bool sinkOn = false, controlOn = false;
        status["sink"] = sink && sink->isConnected(sinkOn) == 0 ? json(sinkOn) : json(nullptr);
        std::unique_ptr<Control> control(Control::getControl(device->getPath()));
        status["control"] = control && control->isConnected(controlOn) == 0 ? json(controlOn) : json(nullptr);
        auto word = [](const json& on) { return on.is_null() ? "none" : on.get<bool>() ? "connected" : "disconnected"; };
        if (options.json)
            out.print(status);
        else
            out.print(address + " audio " + before + " (A2DP sink " + word(status["sink"]) +
                      ", remote control " + word(status["control"]) + ")");
        return kOk;
    }
    bool connect = action == "connect";
    const char* wanted = connect ? "connected" : "disconnected";
    std::string now = before;
    if (before != wanted) {
        if ((connect ? all->connect() : all->disconnect()) != 0)
            throw failed(std::string("audio ") + action, *all);
        out.progress(std::string(connect ? "connecting" : "disconnecting") + " audio of " + address);
        // Sent without waiting: the State property tells how it went.
        waitUntil([&] { now = state(*all); return now == wanted || now == "disconnected"; },
                  std::chrono::seconds(10));
        out.progress("");
        if (now != wanted)
            throw Failure("audio " + action + " " + address + " failed: bluetoothd reports State " + now);
    }
    if (options.json)
        out.print(json{{"address", address}, {"state", now}});
    else
        out.print(address + " audio " + now + (before == wanted ? " (already)" : ""));
    return kOk;
}

int volume(const Options& options, const std::string& direction, const std::string& address) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    std::unique_ptr<Device> device = knownDevice(*chosen, address);
    std::unique_ptr<Control> control = made(Control::getControl(device->getPath()));
    bool connected = false;
    if (control->isConnected(connected) != 0)
        throw Failure(address + " has no remote control (" + control->getErrorMessage() + ")");
    if (!connected)
        throw Failure("the remote control of " + address + " is not connected (connect its audio first)");
    bool up = direction == "up";
    if ((up ? control->volumeUp() : control->volumeDown()) != 0)
        throw failed(up ? "VolumeUp" : "VolumeDown", *control);
    Output out(options);
    const char* key = up ? "VolumeUp" : "VolumeDown";
    if (options.json)
        out.print(json{{"address", address}, {"sent", key}});
    else
        out.print(std::string(key) + " sent to " + address);
    return kOk;
}

}  // namespace btbusctl
