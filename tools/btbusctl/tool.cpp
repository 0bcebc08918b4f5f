#include "tool.h"

#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <iostream>

using namespace Bluetooth;

namespace btbusctl {

Output::Output(const Options& options)
    : json_(options.json), terminal_(!options.json && isatty(STDOUT_FILENO) == 1) {}

Output::~Output() { progress(""); }

void Output::print(const std::string& line) {
    std::lock_guard<std::mutex> hold(lock_);
    if (!text_.empty()) std::cout << "\r\033[K";
    std::cout << line << std::endl;
}

void Output::progress(const std::string& text) {
    if (!terminal_) return;
    {
        std::lock_guard<std::mutex> hold(lock_);
        text_ = text;
        if (text.empty()) std::cout << "\r\033[K" << std::flush;
    }
    if (text.empty() && spinner_.joinable()) {
        stop_ = true;
        spinner_.join();
        stop_ = false;
    } else if (!text.empty() && !spinner_.joinable()) {
        spinner_ = std::thread(&Output::spin, this);
    }
}

void Output::spin() {
    sigset_t all;
    sigfillset(&all);
    pthread_sigmask(SIG_BLOCK, &all, 0);  // signals are the main thread's business
    static const char kFrames[] = "|/-\\";
    for (unsigned frame = 0; !stop_; ++frame) {
        {
            std::lock_guard<std::mutex> hold(lock_);
            if (!text_.empty())
                std::cout << "\r\033[K" << kFrames[frame % 4] << ' ' << text_ << std::flush;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
}

namespace {
sigset_t stopSignals() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    sigaddset(&set, SIGTERM);
    return set;
}
}  // namespace

void blockStopSignals() {
    sigset_t set = stopSignals();
    pthread_sigmask(SIG_BLOCK, &set, 0);
}

bool waitForStop(std::chrono::milliseconds timeout) {
    sigset_t set = stopSignals();
    if (timeout.count() == 0) {
        int signo = 0;
        return sigwait(&set, &signo) == 0;
    }
    timespec wait = {static_cast<time_t>(timeout.count() / 1000),
                     static_cast<long>(timeout.count() % 1000) * 1000000L};
    return sigtimedwait(&set, 0, &wait) > 0;
}

bool stopRequested() {
    sigset_t pending;
    sigpending(&pending);
    return sigismember(&pending, SIGINT) == 1 || sigismember(&pending, SIGTERM) == 1;
}

std::unique_ptr<Manager> manager() {
    std::unique_ptr<Manager> found(Manager::getManager());
    if (found) return found;
    DBusConnection* bus = Connection::get(DBUS_BUS_SYSTEM);
    if (bus == 0) throw Failure("cannot reach the system bus");
    Connection::unref(bus);
    throw Failure("bluetoothd is not running on the system bus");
}

std::unique_ptr<Adapter> adapter(Manager& manager, const Options& options) {
    if (options.adapter.empty()) {
        std::unique_ptr<Adapter> found(manager.defaultAdapter());
        if (!found) throw Failure("no default adapter: " + manager.getErrorMessage());
        return found;
    }
    std::unique_ptr<Adapter> found(manager.findAdapter(options.adapter.c_str()));
    if (!found) throw Failure("adapter " + options.adapter + ": " + manager.getErrorMessage());
    return found;
}

namespace {
std::atomic<int> gRestarts{0};
void onBluetoothd(RemoteObject*, bool running) {
    if (running) ++gRestarts;
}
}  // namespace

void watchRestarts(Manager& manager) {
    if (manager.setBluetoothdHandler(&onBluetoothd) != 0) throw Failure("cannot follow bluetoothd on the system bus");
}

bool restarted() { return gRestarts.exchange(0) > 0; }

std::unique_ptr<Adapter> adapterAfterRestart(Manager& manager, const Options& options) {
    for (int tries = 0; tries < 50 && !stopRequested(); ++tries) {
        Adapter* found = options.adapter.empty() ? manager.defaultAdapter()
                                                 : manager.findAdapter(options.adapter.c_str());
        if (found != 0) return std::unique_ptr<Adapter>(found);
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return nullptr;
}

void reportRestart(Output& out, const Adapter& adapter, const std::string& now) {
    if (out.jsonMode())
        out.print(json{{"event", "restarted"}, {"adapter", shortName(adapter.getPath())}});
    else
        out.print("bluetoothd restarted: " + now);
}

std::pair<std::string, std::string> adapterIdentity(const Options& options) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    Dict props = properties(*chosen);
    return std::make_pair(shortName(chosen->getPath()), find(&props, "Address"));
}

std::string shortName(const std::string& path) {
    std::string last = path.substr(path.rfind('/') + 1);
    if (last.compare(0, 4, "dev_") != 0) return last;
    last.erase(0, 4);
    for (char& c : last)
        if (c == '_') c = ':';
    return last;
}

std::unique_ptr<Device> knownDevice(Adapter& adapter, const std::string& address) {
    std::unique_ptr<Device> device(adapter.findDevice(address.c_str(), false));
    if (!device) throw Failure(address + ": " + adapter.getErrorMessage());
    return device;
}

Dict properties(BluezObject& object) {
    std::unique_ptr<Dict> dict(object.BluezObject::getProperties());
    if (!dict) throw failed(std::string(object.getInterface()) + ".GetProperties", object);
    return *dict;
}

void settle(BluezObject& object) { delete object.BluezObject::getProperties(); }

Dict adapterProperties(Adapter& adapter) {
    std::unique_ptr<Dict> dict(adapter.getProperties());
    if (!dict) throw failed("GetProperties", adapter);
    return *dict;
}

const Variant* lookup(const Dict& dict, const std::string& name) {
    for (const Entry& entry : dict)
        if (entry.first == name) return &entry.second;
    return 0;
}

namespace {
struct ToJson : boost::static_visitor<json> {
    template <typename T>
    json operator()(const T& value) const { return json(value); }
};
}  // namespace

json toJson(const Variant& value) { return boost::apply_visitor(ToJson(), value); }

json toJson(const Dict& dict) {
    json object = json::object();
    for (const Entry& entry : dict)
        if (!object.contains(entry.first)) object[entry.first] = toJson(entry.second);
    return object;
}

std::string toText(const Variant& value) {
    if (const bool* flag = boost::get<bool>(&value)) return *flag ? "yes" : "no";
    if (const std::vector<std::string>* list = boost::get<std::vector<std::string> >(&value)) {
        std::string text;
        for (const std::string& item : *list) text += (text.empty() ? "" : ", ") + item;
        return list->empty() ? "(none)" : text;
    }
    return variantToString(value);
}

std::string dictText(const Dict& dict, const std::string& indent) {
    std::string text;
    for (const Entry& entry : dict) {
        std::string value = toText(entry.second);
        if (entry.first == "Class" && entry.second.which() == 0) {
            char hex[16];
            snprintf(hex, sizeof hex, "0x%06x", boost::get<unsigned int>(entry.second));
            value = hex;
        }
        text += (text.empty() ? "" : "\n") + indent + entry.first + ": " + value;
    }
    return text;
}

bool waitUntil(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!done()) {
        if (std::chrono::steady_clock::now() >= deadline) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return true;
}

Failure failed(const std::string& what, RemoteObject& object) {
    std::string why = object.getErrorMessage();
    return Failure(what + ": " + (why.empty() ? "failed" : why));
}

}  // namespace btbusctl
