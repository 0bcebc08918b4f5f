// adapters, show, set, scan.
#include <cstdlib>
#include <map>
#include <set>
#include <sstream>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

int listAdapters(const Options& options) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<AdapterList> all(bluez->listAdapters());
    if (!all) throw failed("ListAdapters", *bluez);
    std::unique_ptr<Adapter> byDefault(bluez->defaultAdapter());
    std::string defaultPath = byDefault ? byDefault->getPath() : "";

    json list = json::array();
    std::ostringstream text;
    for (Adapter* each : *all) {
        if (each == 0) continue;
        Dict props = properties(*each);
        const Variant* powered = lookup(props, "Powered");
        json entry = {{"adapter", shortName(each->getPath())},
                      {"path", each->getPath()},
                      {"address", find(&props, "Address")},
                      {"name", find(&props, "Name")},
                      {"powered", powered != 0 && variantToBool(*powered)},
                      {"default", defaultPath == each->getPath()}};
        list.push_back(entry);
        text << (entry["default"] ? "* " : "  ") << entry["adapter"].get<std::string>() << "  "
             << entry["address"].get<std::string>() << "  "
             << (entry["powered"] ? "powered  " : "off      ") << entry["name"].get<std::string>()
             << "\n";
    }
    Output out(options);
    if (options.json)
        out.print(list);
    else
        out.print(list.empty() ? std::string("no adapters") : text.str() + "(* the default adapter)");
    return kOk;
}

int showAdapter(const Options& options) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    Dict props = adapterProperties(*chosen);
    // The library leaves HCIVersion out when /usr/bin/hciconfig cannot run.
    bool noVersion = lookup(props, "HCIVersion") == 0;
    Output out(options);
    if (options.json) {
        json shown = toJson(props);
        if (noVersion) shown["HCIVersion"] = nullptr;
        shown["Path"] = chosen->getPath();
        out.print(shown);
    } else {
        out.print(shortName(chosen->getPath()) + " (" + chosen->getPath() + ")\n" + dictText(props) +
                  (noVersion ? "\n  HCIVersion: unknown (/usr/bin/hciconfig did not run)" : ""));
    }
    return kOk;
}

namespace {

enum Kind { kText, kFlag, kSeconds };
const std::map<std::string, Kind> kWritable = {
    {"Name", kText},        {"Powered", kFlag},           {"Discoverable", kFlag},
    {"Pairable", kFlag},    {"DiscoverableTimeout", kSeconds}, {"PairableTimeout", kSeconds}};

Variant typedValue(const std::string& property, const std::string& text) {
    auto kind = kWritable.find(property);
    if (kind == kWritable.end())
        throw UsageError("unknown property " + property +
                         " (writable: Name, Powered, Discoverable, Pairable, "
                         "DiscoverableTimeout, PairableTimeout)");
    switch (kind->second) {
    case kText:
        return Variant(text);
    case kFlag:
        for (const char* yes : {"true", "yes", "on", "1"})
            if (text == yes) return Variant(true);
        for (const char* no : {"false", "no", "off", "0"})
            if (text == no) return Variant(false);
        throw UsageError(property + " takes true or false, not '" + text + "'");
    case kSeconds: {
        char* end = 0;
        unsigned long seconds = std::strtoul(text.c_str(), &end, 10);
        if (text.empty() || *end != '\0' || text[0] == '-' || seconds > 0xffffffffUL)
            throw UsageError(property + " takes a number of seconds, not '" + text + "'");
        return Variant(static_cast<unsigned int>(seconds));
    }
    }
    return Variant();
}

}  // namespace

int setProperty(const Options& options, const std::string& name, const std::string& property,
                const std::string& text) {
    Variant value = typedValue(property, text);
    Options chosenOne = options;
    chosenOne.adapter = name;
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, chosenOne);
    if (chosen->setProperty(property.c_str(), value) != 0) throw failed("SetProperty", *chosen);
    // SetProperty is sent without waiting: read the property back to know.
    Variant now;
    bool applied = waitUntil(
        [&] {
            Dict props = properties(*chosen);
            const Variant* current = lookup(props, property);
            if (current) now = *current;
            return current != 0 && *current == value;
        },
        std::chrono::seconds(2));
    if (!applied)
        throw Failure("bluetoothd did not apply " + property + " = " + toText(value) + " on " +
                      shortName(chosen->getPath()) + " (it reads " + toText(now) + ")");
    Output out(options);
    if (options.json)
        out.print(json{{"adapter", shortName(chosen->getPath())}, {"property", property},
                       {"value", toJson(now)}});
    else
        out.print(shortName(chosen->getPath()) + ": " + property + " is now " + toText(now));
    return kOk;
}

// ---- scan ----

namespace {

// The receiving thread's view of one scan: where to print, what was seen.
struct Scan {
    Output* out = 0;
    std::mutex lock;
    std::set<std::string> present;
};
Scan gScan;

void deviceFound(RemoteObject*, const char* address, const Dict* props) {
    {
        std::lock_guard<std::mutex> hold(gScan.lock);
        if (!gScan.present.insert(address).second) return;  // seen in an earlier round
    }
    if (gScan.out->jsonMode()) {
        gScan.out->print(json{{"event", "found"}, {"address", address}, {"properties", toJson(*props)}});
        return;
    }
    std::string line = std::string("found  ") + address + "  " + find(props, "Alias");
    if (lookup(*props, "RSSI")) line += "  RSSI " + find(props, "RSSI");
    gScan.out->print(line);
}

void deviceDisappeared(RemoteObject*, const char* address) {
    {
        std::lock_guard<std::mutex> hold(gScan.lock);
        gScan.present.erase(address);
    }
    if (gScan.out->jsonMode())
        gScan.out->print(json{{"event", "disappeared"}, {"address", address}});
    else
        gScan.out->print(std::string("gone   ") + address);
}

bool discovering(Adapter& adapter) {
    Dict props = properties(adapter);
    const Variant* on = lookup(props, "Discovering");
    return on != 0 && variantToBool(*on);
}

}  // namespace

int scan(const Options& options, int seconds) {
    blockStopSignals();  // before the receiving thread starts, so that it inherits the mask
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    Output out(options);
    gScan.out = &out;
    chosen->setDeviceFoundHandler(&deviceFound);
    chosen->setDeviceDisappearedHandler(&deviceDisappeared);
    watchRestarts(*bluez);
    bluez->startLoop();
    if (chosen->startDiscovery() != 0) throw failed("StartDiscovery", *chosen);
    // Sent without waiting: a refusal (adapter off) only shows as no discovery.
    if (!waitUntil([&] { return discovering(*chosen); }, std::chrono::seconds(3))) {
        bluez->stopLoop();
        bluez->waitLoop();
        Dict props = properties(*chosen);
        const Variant* powered = lookup(props, "Powered");
        throw Failure("discovery did not start on " + shortName(chosen->getPath()) +
                      (powered && !variantToBool(*powered) ? ": the adapter is off" : ""));
    }
    if (options.json) out.print(json{{"event", "scanning"}, {"adapter", shortName(chosen->getPath())}});
    auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    while (seconds == 0 || std::chrono::steady_clock::now() < end) {
        std::ostringstream text;
        text << "scanning on " << shortName(chosen->getPath());
        if (seconds > 0)
            text << ", " << std::chrono::duration_cast<std::chrono::seconds>(
                                end - std::chrono::steady_clock::now()).count() + 1
                 << " s left";
        text << " (Ctrl-C stops)";
        out.progress(text.str());
        if (waitForStop(std::chrono::milliseconds(250))) break;
        if (!restarted()) continue;
        // The new daemon's adapter has a new path, and discovers nothing yet.
        std::unique_ptr<Adapter> again = adapterAfterRestart(*bluez, options);
        if (!again) continue;
        chosen = std::move(again);  // the old proxy's handlers go with it
        {
            std::lock_guard<std::mutex> hold(gScan.lock);
            gScan.present.clear();
        }
        chosen->setDeviceFoundHandler(&deviceFound);
        chosen->setDeviceDisappearedHandler(&deviceDisappeared);
        chosen->startDiscovery();
        reportRestart(out, *chosen, "scanning on " + shortName(chosen->getPath()) + " again");
    }
    out.progress("");
    chosen->stopDiscovery();
    settle(*chosen);
    bluez->stopLoop();
    bluez->waitLoop();
    gScan.out = 0;
    return kOk;
}

}  // namespace btbusctl
