#include <bluetooth/util.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <bluetooth/bluetooth.h>
#include <bluetooth/hci.h>
#include <bluetooth/hci_lib.h>
#include <glob.h>
#include <sys/stat.h>
#include <unistd.h>

#include "core/log.h"
#include "util/commandlib.h"
#include "util/process.h"

BT_LOG_FILE("commandlib.cpp");

namespace Bluetooth {

namespace {

const char kDaemonName[] = "bluetoothd";
const char kDaemonProgram[] = "/usr/sbin/bluetoothd";
const char kAdapterMarkers[] = "/tmp/bluetooth.info_*";
// bluetoothd detaches itself at once; one that stays in the foreground after
// this long is left running.
const int kDaemonStartMilliseconds = 10000;
const int kHciNameLength = 248;

class Glob {
public:
    explicit Glob(const char* pattern) : result_(glob(pattern, 0, 0, &paths_)) {}
    ~Glob() { globfree(&paths_); }
    // 0, GLOB_NOMATCH, or another glob error.
    int result() const { return result_; }
    size_t size() const { return result_ == 0 ? paths_.gl_pathc : 0; }
    const char* operator[](size_t i) const { return paths_.gl_pathv[i]; }

private:
    Glob(const Glob&) = delete;
    Glob& operator=(const Glob&) = delete;

    glob_t paths_;
    int result_;
};

}  // namespace

namespace internal {

int findProcessId(const char* fragment) {
    if (fragment == 0) return -1;
    Glob links("/proc/*/exe");  // sorted: processes in the text order of their paths
    if (links.result() != 0) {
        BT_LOG_ERR("Failed to get glob info.");
        return -1;
    }
    for (size_t i = 0; i < links.size(); ++i) {
        char target[4096];
        memset(target, 0, sizeof target);
        if (readlink(links[i], target, sizeof target - 1) < 0) continue;
        int pid = -1;
        if (strstr(target, fragment) != 0 && sscanf(links[i], "/proc/%d/exe", &pid) == 1) return pid;
    }
    return -1;
}

}  // namespace internal

namespace {

// A marker is a regular file of this user's or root's: a link or a file that
// another user left in the shared /tmp marks no adapter.
bool anAdapterIsAttached() {
    Glob markers(kAdapterMarkers);
    for (size_t i = 0; i < markers.size(); ++i) {
        struct stat marker;
        if (lstat(markers[i], &marker) == 0 && S_ISREG(marker.st_mode) &&
            (marker.st_uid == 0 || marker.st_uid == geteuid()))
            return true;
    }
    return false;
}

}  // namespace

int restartBluetoothd() {
    int pid = internal::findProcessId(kDaemonName);
    if (!anAdapterIsAttached()) {
        BT_LOG_ERR("No dongle. Stop restarting bluetoothd...");
        return -1;
    }
    if (pid > 0) {
        kill(pid, SIGKILL);
        sleep(1);
    }
    const char* const argv[] = { kDaemonProgram, 0 };
    internal::Process daemon(kDaemonProgram, argv, false);
    if (!daemon.waitExit(kDaemonStartMilliseconds)) daemon.release();
    if (internal::findProcessId(kDaemonName) < 0) {
        BT_LOG_ERR("Failed to start bluetoothd");
        return -1;
    }
    return 0;
}

char* getAddressFromPath(const char* path) {
    const char* device = path != 0 ? strstr(path, "dev_") : 0;
    if (device == 0) return 0;
    char* address = strdup(device + 4);
    if (address == 0) return 0;
    for (char* c = address; *c != '\0'; ++c)
        if (*c == '_') *c = ':';
    return address;
}

int getNameFromAddr(const char* address, char* name, int length, GetNameTimeout timeout) {
    if (address == 0 || name == 0 || length < 1) return -1;
    bdaddr_t remote;
    str2ba(address, &remote);
    char remoteName[kHciNameLength + 1];  // + 1: a name of the full length stays terminated
    memset(remoteName, 0, sizeof remoteName);
    int device = hci_get_route(&remote);
    if (device < 0) return -1;
    int socket = hci_open_dev(device);
    if (socket < 0) return -1;
    int result = hci_read_remote_name(socket, &remote, kHciNameLength, remoteName, timeout);
    if (result >= 0) snprintf(name, static_cast<size_t>(length), "%s", remoteName);
    hci_close_dev(socket);
    return result >= 0 ? 0 : -1;
}

}  // namespace Bluetooth
