// scan --shared: the devices that the scanner service's finder collects.
#include <cstdlib>
#include <map>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

int sharedScan(const Options& options, int seconds) {
    blockStopSignals();
    if (std::getenv("DBUS_SESSION_BUS_ADDRESS") == 0)
        throw Failure("the scanner service lives on the session bus, and DBUS_SESSION_BUS_ADDRESS is not set");
    std::string name = adapterIdentity(options).first;
    Scanner scanner;
    Output out(options);
    std::map<std::string, json> seen;
    auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    do {
        out.progress("reading the scanner service's devices of " + name + " (Ctrl-C stops)");
        // Starts the finder (and the service, by bus activation) on first use.
        std::unique_ptr<std::vector<std::pair<std::string, Dict*> > > devices(
            scanner.listDevices(name.c_str(), false));
        if (!devices) throw failed("scanner service", scanner);
        std::map<std::string, json> now;
        for (auto& device : *devices) {
            std::unique_ptr<Dict> props(device.second);
            now[device.first] = toJson(*props);
            if (seen.count(device.first) == 0) {
                if (options.json)
                    out.print(json{{"event", "found"}, {"address", device.first}, {"properties", now[device.first]}});
                else
                    out.print("found  " + device.first + "  " + find(props.get(), "Alias") + "  RSSI " +
                              find(props.get(), "RSSI"));
            }
        }
        for (auto& before : seen)
            if (now.count(before.first) == 0)
                out.print(options.json ? json{{"event", "disappeared"}, {"address", before.first}}.dump()
                                       : "gone   " + before.first);
        seen.swap(now);
    } while (!waitForStop(std::chrono::seconds(1)) &&
             (seconds == 0 || std::chrono::steady_clock::now() < end));
    return kOk;
}

}  // namespace btbusctl
