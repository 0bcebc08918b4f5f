// btbusctl's shared pieces: options, failures, output in both forms, waiting.
#ifndef BTBUSCTL_TOOL_H
#define BTBUSCTL_TOOL_H

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>

#include <nlohmann/json.hpp>

#include <bluetooth/btbus.h>

namespace btbusctl {

using nlohmann::json;

// Exit statuses.
enum { kOk = 0, kFailed = 1, kUsage = 2 };

// An operation failed: the message goes to stderr and the exit status is 1.
struct Failure : std::runtime_error {
    using std::runtime_error::runtime_error;
};
// The command line asks for something impossible: exit status 2.
struct UsageError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

// What every command receives.
struct Options {
    std::string adapter;  // -a: a name or an address; "" for BlueZ's default
    bool json = false;
};

// A progress line on stdout, redrawn by its own thread, only when stdout is a
// terminal and the output is for people; every line printed meanwhile goes
// through print(), which clears it first. Safe from any thread.
class Output {
public:
    explicit Output(const Options& options);
    ~Output();
    bool jsonMode() const { return json_; }
    // Prints one line (a JSON object in --json mode) and flushes.
    void print(const std::string& line);
    void print(const json& object) { print(object.dump()); }
    void print(const char* line) { print(std::string(line)); }
    // Starts or replaces the progress text; empty stops it.
    void progress(const std::string& text);

private:
    void spin();
    bool json_, terminal_;
    std::mutex lock_;
    std::string text_;
    std::atomic<bool> stop_{false};
    std::thread spinner_;
};

// SIGINT and SIGTERM are blocked in every thread (call first in main); these
// wait for one. waitForStop returns true when one arrived within the time
// (a zero time waits without end).
void blockStopSignals();
bool waitForStop(std::chrono::milliseconds timeout);
bool stopRequested();  // one arrived and was not consumed yet; does not wait

// The manager, or a Failure that tells a missing bus from a missing bluetoothd.
std::unique_ptr<Bluetooth::Manager> manager();
// The adapter that -a names, else BlueZ's default one.
std::unique_ptr<Bluetooth::Adapter> adapter(Bluetooth::Manager& manager, const Options& options);
// bluetoothd restarts (restartBluetoothd does one when an adapter is attached):
// watchRestarts has manager's receiving thread count them; restarted() tells
// the main thread once of those since it last asked. A new daemon has new
// adapter paths and knows nothing of the old one's agent and discovery.
void watchRestarts(Bluetooth::Manager& manager);
bool restarted();
// The adapter of -a on a bluetoothd that has just started, which announces
// its adapters as it comes up: waits a little for it. Null when it does not
// come, or a stop was asked for meanwhile.
std::unique_ptr<Bluetooth::Adapter> adapterAfterRestart(Bluetooth::Manager& manager, const Options& options);
// "bluetoothd restarted: <what now>", or a JSON event "restarted".
void reportRestart(Output& out, const Bluetooth::Adapter& adapter, const std::string& now);
// The name ("hci0") and address of the adapter that -a names, else of the default one.
std::pair<std::string, std::string> adapterIdentity(const Options& options);
// "hci0" for ".../hci0"; "00:11:.." for ".../dev_00_11_..".
std::string shortName(const std::string& path);
// A device the adapter knows, or a Failure with BlueZ's answer.
std::unique_ptr<Bluetooth::Device> knownDevice(Bluetooth::Adapter& adapter,
                                               const std::string& address);
// The properties of a proxy (BluezObject's own: no hciconfig run), or a Failure.
Bluetooth::Dict properties(Bluetooth::BluezObject& object);
Bluetooth::Dict adapterProperties(Bluetooth::Adapter& adapter);  // with HCIVersion
// A blocking call after one-way requests: once it returns, bluetoothd (which
// handles one client's calls in order) has handled them. Failure is ignored:
// used on the way out, when bluetoothd may be gone already.
void settle(Bluetooth::BluezObject& object);
// A property's value, or an empty Variant-less default.
const Bluetooth::Variant* lookup(const Bluetooth::Dict& dict, const std::string& name);

// Values for people and for scripts.
json toJson(const Bluetooth::Variant& value);
json toJson(const Bluetooth::Dict& dict);
std::string toText(const Bluetooth::Variant& value);
// "  Name: value" lines, without a newline after the last.
std::string dictText(const Bluetooth::Dict& dict, const std::string& indent = "  ");

// Polls until done() or the time is up; true when done() was.
bool waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout);

// Builds the failure text for a proxy whose operation failed.
Failure failed(const std::string& what, Bluetooth::RemoteObject& object);

}  // namespace btbusctl

#endif
