#include <bluetooth/auto_connect.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <bluetooth/fifo.h>
#include <bluetooth/manager.h>
#include <bluetooth/util.h>

#include "autoconnect/config_text.h"
#include "core/log.h"

BT_LOG_FILE("auto_connect.cpp");

namespace Bluetooth {

namespace internal {

bool leadingNumber(const std::string& content, long& value) {
    const char* start = content.c_str();
    char* end = 0;
    value = strtol(start, &end, 10);
    return end != start;
}

bool enabledFlag(const std::string& content) {
    long value = 0;
    return leadingNumber(content, value) && value == 1;
}

std::vector<std::string> storedAddresses(const std::string& content) {
    std::vector<std::string> addresses;
    for (std::string::size_type at = 2; at < content.size();) {
        std::string::size_type comma = content.find(',', at);
        if (comma == std::string::npos) comma = content.size();
        addresses.push_back(content.substr(at, comma - at));
        at = comma + 1;
    }
    return addresses;
}

}  // namespace internal

namespace {

using internal::enabledFlag;
using internal::leadingNumber;
using internal::storedAddresses;

const char kConfigDirectory[] = "/etc/bluetooth/autoconnect/";
const char kCommandPipe[] = "/tmp/quill_bluetooth_autoconnect";

// False (logged as "<what> is null.") when text is null.
bool given(const char* text, const char* what) {
    if (text != 0) return true;
    BT_LOG_ERR("%s is null.", what);
    return false;
}

// The adapter's file; false (logged) for an address that would name a file
// elsewhere.
bool configPath(const char* adapter, std::string& path) {
    if (strchr(adapter, '/') != 0) {
        BT_LOG_ERR("Adapter address '%s' is not a file name.", adapter);
        return false;
    }
    path = std::string(kConfigDirectory) + adapter;
    return true;
}

bool readFile(const std::string& path, std::string& content) {
    FILE* file = fopen(path.c_str(), "rb");
    if (file == 0) return false;
    content.clear();
    char buffer[4096];
    size_t length;
    while ((length = fread(buffer, 1, sizeof buffer, file)) > 0) content.append(buffer, length);
    bool ok = ferror(file) == 0;
    fclose(file);
    return ok;
}

// The file's content; false (logged) when it cannot be read.
bool readConfig(const std::string& path, std::string& content) {
    if (readFile(path, content)) return true;
    BT_LOG_ERR("Cannot open config file '%s'", path.c_str());
    return false;
}

// A new Manager, or null (logged).
Manager* getManager() {
    Manager* manager = Manager::getManager();
    if (manager == 0) BT_LOG_ERR("Failed to get manager.");
    return manager;
}

enum WriteResult { kWritten, kCannotCreate, kCannotWrite };

bool writeAll(int fd, const std::string& content) {
    for (size_t done = 0; done < content.size();) {
        ssize_t written = write(fd, content.data() + done, content.size() - done);
        if (written < 0 && errno == EINTR) continue;
        if (written <= 0) return false;
        done += static_cast<size_t>(written);
    }
    return true;
}

// Puts content at path whole or not at all: written to a new file beside it,
// flushed, then renamed over it (keeping an existing file's owner and mode, and
// a link to it). With createOnly an existing file is left as it is instead.
WriteResult writeAtomically(const std::string& path, const std::string& content, bool createOnly) {
    std::string target = path;
    struct stat old;
    bool replacing = !createOnly && stat(path.c_str(), &old) == 0;
    if (replacing) {
        char* resolved = realpath(path.c_str(), 0);
        if (resolved != 0) target = resolved;
        free(resolved);
    }
    std::string::size_type slash = target.rfind('/');
    std::string prefix = target.substr(0, slash + 1) + "." + target.substr(slash + 1) + ".new-" +
                         std::to_string(static_cast<long>(getpid())) + "-";
    static std::atomic<unsigned> counter(0);
    std::string temporary;
    int fd = -1;
    for (int attempt = 0; fd < 0 && attempt < 100; ++attempt) {
        temporary = prefix + std::to_string(counter++);
        fd = open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
        if (fd < 0 && errno != EEXIST) return kCannotCreate;
    }
    if (fd < 0) return kCannotCreate;
    if (replacing) {
        if (fchown(fd, old.st_uid, old.st_gid) != 0) {
            // Only root may keep another owner: the file becomes this process's.
        }
        fchmod(fd, old.st_mode & 07777);  // best effort, like the owner
    }
    bool ok = writeAll(fd, content) && fsync(fd) == 0;
    ok = close(fd) == 0 && ok;
    if (ok && createOnly) {
        ok = link(temporary.c_str(), target.c_str()) == 0 || errno == EEXIST;  // made meanwhile: kept
        unlink(temporary.c_str());
    } else if (ok) {
        ok = rename(temporary.c_str(), target.c_str()) == 0;
    }
    if (!ok) unlink(temporary.c_str());
    return ok ? kWritten : kCannotWrite;
}

// Appends the devices that adapter knows to devices; the other addresses go to
// unknown, in the order read.
void collectDevices(Adapter& adapter, const std::string& content, DeviceList& devices,
                    std::vector<std::string>& unknown) {
    std::vector<std::string> addresses = storedAddresses(content);
    for (size_t i = 0; i < addresses.size(); ++i) {
        Device* device = adapter.findDevice(addresses[i].c_str(), true);
        if (device != 0)
            devices.push_back(device);
        else
            unknown.push_back(addresses[i]);
    }
}

// The adapter's file, made sure of by checkConfigFile; false when unusable.
bool usableFile(const AutoConnect& config, const char* adapter, std::string& path) {
    return configPath(adapter, path) && config.checkConfigFile(path.c_str());
}

}  // namespace

bool AutoConnect::checkConfigFile(const char* path) const {
    if (path == 0) path = "";
    struct stat info;
    if (lstat(path, &info) == 0) {
        // A link counts as what it leads to; a dangling one as no regular file.
        if (S_ISLNK(info.st_mode) && stat(path, &info) != 0) info.st_mode = S_IFLNK;
        if (!S_ISREG(info.st_mode)) {
            BT_LOG_ERR("Config '%s' is not regular file.", path);
            return false;
        }
        if (access(path, R_OK | W_OK) != 0) {
            BT_LOG_ERR("Config '%s' can not be write/read.", path);
            return false;
        }
        return true;
    }
    if (mkdir(kConfigDirectory, 0755) != 0 && errno != EEXIST) {
        BT_LOG_ERR("Can not create config path '%s'", kConfigDirectory);
        return false;
    }
    if (writeAtomically(path, "0", true) != kWritten) {
        BT_LOG_ERR("Config '%s' can not be open.", path);
        return false;
    }
    return true;
}

bool AutoConnect::getEnable(const char* adapter) const {
    if (!given(adapter, "Adapter address")) return false;
    std::string path, content;
    if (!usableFile(*this, adapter, path)) return false;
    long flag = 0;
    return readFile(path, content) && leadingNumber(content, flag) && flag != 0;
}

// deliberate: "Can not open config file '%s'." here, "Cannot open config file
// '%s'" everywhere else.
bool AutoConnect::set(const char* adapter, bool enable, const char* deviceList) {
    if (!given(adapter, "Adapter address") || !given(deviceList, "Device address list")) return false;
    std::string path;
    if (!usableFile(*this, adapter, path)) return false;
    switch (writeAtomically(path, std::string(enable ? "1" : "0") + deviceList, false)) {
    case kCannotCreate:
        BT_LOG_ERR("Can not open config file '%s'.", path.c_str());
        return false;
    case kCannotWrite:
        BT_LOG_ERR("Can not write config file '%s'.", path.c_str());
        return false;
    case kWritten:
        break;
    }
    reload();  // the file is what counts; a daemon not listening reads it when it starts
    return true;
}

bool AutoConnect::removeDevice(const char* adapter, const char* device) {
    if (!given(adapter, "Adapter address") || !given(device, "Device address")) return false;
    std::string path, content;
    if (!usableFile(*this, adapter, path)) return false;
    if (!readConfig(path, content)) return false;
    if (!enabledFlag(content)) return true;  // deliberate: only enabled lists are pruned
    std::vector<std::string> addresses = storedAddresses(content);
    std::string kept;
    for (size_t i = 0; i < addresses.size(); ++i)
        if (addresses[i] != device) kept += "," + addresses[i];
    set(adapter, true, kept.c_str());  // its result is not passed on
    return true;
}

DeviceList* AutoConnect::getDeviceList(const char* adapter) {
    if (!given(adapter, "Adapter address")) return 0;
    std::unique_ptr<Manager> manager(getManager());
    if (manager == 0) return 0;
    std::unique_ptr<Adapter> bluez(manager->findAdapter(adapter));
    if (bluez == 0) {
        BT_LOG_ERR("Failed to get adapter.");
        return 0;
    }
    std::string path, content;
    if (!usableFile(*this, adapter, path)) return 0;
    if (!readConfig(path, content)) return 0;
    DeviceList* devices = new DeviceList;
    std::vector<std::string> unknown;
    collectDevices(*bluez, content, *devices, unknown);
    for (size_t i = 0; i < unknown.size(); ++i) removeDevice(adapter, unknown[i].c_str());
    return devices;
}

DeviceList* AutoConnect::getAutoConnectDeviceList() {
    std::unique_ptr<Manager> manager(getManager());
    if (manager == 0) return 0;
    std::unique_ptr<AdapterList> adapters(manager->listAdapters());
    if (adapters == 0) {
        BT_LOG_ERR("Failed to get adapter list");
        return 0;
    }
    DeviceList* devices = new DeviceList;
    for (AdapterList::iterator it = adapters->begin(); it != adapters->end(); ++it) {
        if (*it == 0) continue;  // bluetoothd went away meanwhile
        std::unique_ptr<Dict> properties((*it)->getProperties());
        std::string address = find(properties.get(), "Address");
        if (find(properties.get(), "Powered") != "1") continue;
        std::string path, content;
        if (!usableFile(*this, address.c_str(), path)) continue;
        if (!readConfig(path, content) || !enabledFlag(content)) continue;
        std::vector<std::string> unknown;
        collectDevices(**it, content, *devices, unknown);
        for (size_t i = 0; i < unknown.size(); ++i) removeDevice(address.c_str(), unknown[i].c_str());
    }
    return devices;
}

bool AutoConnect::sendCommand(const char* command) const {
    if (command == 0) return false;
    std::unique_ptr<Fifo> pipe(Fifo::getWriteFifo(kCommandPipe));
    if (pipe == 0) return false;  // no daemon reading: logged by Fifo
    return pipe->writeData(command, static_cast<int>(strlen(command))) == 0;
}

bool AutoConnect::reload() const { return sendCommand("1"); }

bool AutoConnect::pause() const { return sendCommand("pause"); }

bool AutoConnect::resume() const { return sendCommand("resume"); }

}  // namespace Bluetooth
