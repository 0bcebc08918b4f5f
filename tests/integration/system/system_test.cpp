// AutoConnect, restartBluetoothd and the private mounts they are tested in: each test runs in a private mount
// and process namespace whose /tmp, /etc and /usr/sbin are its own and whose /proc shows only its processes.
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <set>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "support/log_capture.h"
#include "support/namespace.h"
#include "support/process.h"
#include "support/sim.h"
#include "util/commandlib.h"

namespace {

using namespace Bluetooth;
using btbus_test::LogCapture;
using Lines = std::vector<std::string>;
namespace sim = btbus_test::sim;

const char kDirectory[] = "/etc/bluetooth/autoconnect/";
const char kAdapter[] = "00:11:22:33:44:55";
const std::string kFile = std::string(kDirectory) + kAdapter;
const char kPipe[] = "/tmp/quill_bluetooth_autoconnect";
const char kMissing[] = "<missing>";
const char kNoReader[] = "<no reader>";

// What stands at path: its content, or a word for what is not a file.
std::string standing(const std::string& path) {
    struct stat info;
    if (lstat(path.c_str(), &info) != 0) return kMissing;
    if (S_ISDIR(info.st_mode) || S_ISLNK(info.st_mode)) return S_ISDIR(info.st_mode) ? "<directory>" : "<link>";
    return std::string(std::istreambuf_iterator<char>(std::ifstream(path).rdbuf()), {});
}

// A missing file leaves the directory as it is, for the library to create.
void writeFile(const std::string& path, const std::string& content) {
    std::filesystem::remove_all(path);
    if (content == kMissing) return;
    mkdir(kDirectory, 0755);
    std::ofstream(path) << content;
}

// What the auto-connect daemon, reading the pipe at fd, has read; kNoReader
// when none reads (fd -1).
std::string taken(int fd) {
    std::string bytes = fd < 0 ? kNoReader : "";
    char buffer[4096];
    for (ssize_t n; fd >= 0 && (n = read(fd, buffer, sizeof buffer)) > 0;) bytes.append(buffer, n);
    close(fd);
    return bytes;
}

// The paths of a list that the caller owns, deleted here; "<null>" for none.
Lines pathsOf(DeviceList* devices) {
    std::unique_ptr<DeviceList> owned(devices);
    Lines paths;
    for (size_t i = 0; owned && i < owned->size(); ++i) paths.push_back((*owned)[i]->getPath());
    return owned ? paths : Lines{ "<null>" };
}

using Operation = std::function<bool(AutoConnect&)>;
Operation enabled(const char* adapter) { return [=](AutoConnect& c) { return c.getEnable(adapter); }; }
Operation set(const char* adapter, bool on, const char* list) { return [=](AutoConnect& c) { return c.set(adapter, on, list); }; }
Operation remove(const char* device) { return [=](AutoConnect& c) { return c.removeDevice(kAdapter, device); }; }
Operation send(bool (AutoConnect::*command)() const) { return [=](AutoConnect& c) { return (c.*command)(); }; }

TEST(AutoConnect, KeepsItsFilesTellsItsDaemonAndListsTheDevicesBluetoothdKnows) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    std::string why;
    ASSERT_TRUE(btbus_test::privateSystemDirectories(why)) << why;
    std::string longList;
    for (int i = 0; i < 100000; ++i) longList += ",AA:BB:CC:" + std::to_string(100000 + i);
    const std::string notRegular = "Config '" + kFile + "' is not regular file.";
    AutoConnect config;
    const struct { std::string before; Operation operation; bool result; std::string after, command; Lines log; } kCases[] = {
        { kMissing, enabled(kAdapter), false, "0", "", {} },  // the directory made too
        { "1,A", enabled(kAdapter), true, "1,A", "", {} },
        { " 7", enabled(kAdapter), true, " 7", "", {} },
        { "", enabled(kAdapter), false, "", "", {} },
        { "x1", enabled(kAdapter), false, "x1", "", {} },
        { kMissing, set(kAdapter, true, ",AA:BB:CC:DD:EE:01"), true, "1,AA:BB:CC:DD:EE:01", "1", {} },
        { "1,A", set(kAdapter, false, ""), true, "0", "1", {} },
        { "1,A,B,A", remove("A"), true, "1,B", "1", {} },
        { "0,A", remove("A"), true, "0,A", "", {} },  // a disabled list is left alone
        { "1,A,", remove("B"), true, "1,A", "1", {} },
        { "1", remove("A"), true, "1", "1", {} },
        { "11,A", remove("A"), true, "11,A", "", {} },
        { "x,A", remove("A"), true, "x,A", "", {} },
        { "1" + longList, remove("AA:BB:CC:100000"), true, "1" + longList.substr(16), "1", {} },
        { "1,A", enabled(nullptr), false, "1,A", "", { "Adapter address is null." } },
        { "1,A", set(kAdapter, true, nullptr), false, "1,A", "", { "Device address list is null." } },
        { "1,A", remove(nullptr), false, "1,A", "", { "Device address is null." } },
        { "1,A", set("../x", true, ""), false, "1,A", "", { "Adapter address '../x' is not a file name." } },
        { "<directory>", set(kAdapter, true, ",A"), false, "<directory>", "", { notRegular } },
        { "<link>", enabled(kAdapter), false, "<link>", "", { notRegular } },
        { "1,A", send(&AutoConnect::reload), true, "1,A", "1", {} },
        { "1,A", send(&AutoConnect::pause), true, "1,A", "pause", {} },
        { "1,A", send(&AutoConnect::resume), true, "1,A", "resume", {} },
        // With no daemon reading, a command fails at once (a wait would hang
        // the test) while the file still counts.
        { "1,A", send(&AutoConnect::reload), false, "1,A", kNoReader, {} },
        { "1,A", send(&AutoConnect::pause), false, "1,A", kNoReader, {} },
        { "1,A", send(&AutoConnect::resume), false, "1,A", kNoReader, {} },
        { "0", set(kAdapter, true, ",A"), true, "1,A", kNoReader, {} },
    };
    mkfifo(kPipe, 0666);
    for (const auto& row : kCases) {
        SCOPED_TRACE(row.before.substr(0, 20) + " " + row.command);
        writeFile(kFile, row.before[0] == '<' ? kMissing : row.before);
        if (row.before == "<directory>") mkdir(kFile.c_str(), 0755);
        if (row.before == "<link>") symlink("/etc/bluetooth/nowhere", kFile.c_str());
        int daemon = row.command == kNoReader ? -1 : open(kPipe, O_RDONLY | O_NONBLOCK);
        LogCapture log;
        EXPECT_EQ(row.operation(config), row.result);
        EXPECT_EQ(log.from("auto_connect.cpp"), row.log);
        EXPECT_EQ(standing(kFile), row.after);
        EXPECT_EQ(taken(daemon), row.command);
    }
    EXPECT_EQ(standing("/etc/bluetooth/nowhere"), kMissing);
    EXPECT_EQ(std::filesystem::status(kDirectory).permissions(), std::filesystem::perms(0755));

    // The device lists, against bluez4-sim.
    ASSERT_TRUE(sim::start());
    const std::string hci0 = "00:1A:7D:DA:71:13", hci1 = "00:1A:7D:DA:71:14";
    std::string hci1Path = sim::addAdapter("hci1", hci1);
    sim::addDevice("hci0", R"({"address": "00:11:22:AA:BB:CC", "created": true})");
    sim::addDevice("hci1", R"({"address": "00:11:22:AA:BB:DD", "created": true})");
    const std::string mouse = sim::devicePath(sim::kMouse), other = sim::devicePath("00:11:22:AA:BB:CC");
    const std::string onHci1 = hci1Path + "/dev_00_11_22_AA_BB_DD";
    const std::string list0 = std::string(",") + sim::kMouse + ",00:00:00:00:00:01,00:11:22:AA:BB:CC";
    const std::string list1 = ",00:11:22:AA:BB:DD,00:00:00:00:00:01";

    // Known devices in file order; the unknown address pruned from an enabled file only.
    for (std::string flag : { "1", "0" }) {
        writeFile(kDirectory + hci0, flag + list0);
        LogCapture log;
        EXPECT_EQ(pathsOf(config.getDeviceList(hci0.c_str())), (Lines{ mouse, other }));
        EXPECT_EQ(standing(kDirectory + hci0), flag == "1" ? std::string("1,") + sim::kMouse + ",00:11:22:AA:BB:CC" : flag + list0);
        EXPECT_EQ(log.from("adapter.cpp").size(), 1u) << "the unknown address, logged by the adapter";
    }
    LogCapture lists;
    EXPECT_EQ(pathsOf(config.getDeviceList("00:00:00:00:00:99")), Lines{ "<null>" });
    EXPECT_EQ(lists.from("auto_connect.cpp"), Lines{ "Failed to get adapter." });

    // Every powered adapter whose list is enabled. The library's calls keep
    // their order: Powered is set before the list reads it.
    std::unique_ptr<Adapter> second(Adapter::getAdapter(hci1Path.c_str()));
    const struct { std::string flag0; bool powered1; Lines paths; } kPowered[] = {
        { "1", true, { mouse, other, onHci1 } },
        { "1", false, { mouse, other } },
        { "0", true, { onHci1 } },
    };
    for (const auto& row : kPowered) {
        writeFile(kDirectory + hci0, row.flag0 + list0);
        writeFile(kDirectory + hci1, "1" + list1);
        second->setProperty("Powered", Variant(row.powered1));
        EXPECT_EQ(pathsOf(config.getAutoConnectDeviceList()), row.paths);
        EXPECT_EQ(standing(kDirectory + hci1), row.powered1 ? "1,00:11:22:AA:BB:DD" : "1" + list1);
    }

    sim::kill();
    lists.clear();
    EXPECT_EQ(pathsOf(config.getDeviceList(hci0.c_str())), Lines{ "<null>" });
    EXPECT_EQ(pathsOf(config.getAutoConnectDeviceList()), Lines{ "<null>" });
    EXPECT_EQ(lists.from("auto_connect.cpp"), Lines(2, "Failed to get manager."));

    // A full disk keeps the old list whole, with no new file left beside it.
    ASSERT_EQ(mount("tmpfs", kDirectory, "tmpfs", 0, "size=8k"), 0);
    writeFile(kFile, "1,A");
    int daemon = open(kPipe, O_RDONLY | O_NONBLOCK);
    LogCapture log;
    EXPECT_FALSE(config.set(kAdapter, true, std::string(64 * 1024, ',').c_str()));
    EXPECT_EQ(log.from("auto_connect.cpp"), Lines{ "Can not write config file '" + kFile + "'." });
    EXPECT_EQ(standing(kFile), "1,A");
    EXPECT_EQ(taken(daemon), "");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(kDirectory), {}), 1);
}

TEST(RestartingBluetoothd, NeedsAnAttachedAdapterAndKillsTheOldDaemon) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    std::string why;
    ASSERT_TRUE(btbus_test::privateSystemDirectories(why)) << why;
    using Bluetooth::internal::findProcessId;
    // A copy of sleep at a path that names bluetoothd: what the search sees.
    const char daemonCopy[] = "/tmp/bin/bluetoothd", starts[] = "/tmp/starts";  // a byte per start
    mkdir("/tmp/bin", 0755);
    std::filesystem::copy_file("/bin/sleep", daemonCopy);
    // Like bluetoothd, it leaves its daemon running under its own name when it exits.
    const std::string detaching = std::string(daemonCopy) + " 60 &\nuntil [ \"$(readlink /proc/$!/exe)\" = " +
                                  daemonCopy + " ]; do :; done\n";
    enum Marker { kNone, kFile, kLink };  // a link, which another user could plant in /tmp, marks no adapter
    // program: what /usr/sbin/bluetoothd runs after it counts its start; null: no such program.
    const struct { const char* name; Marker marker; bool running; const char* program; int result; Lines log; } kCases[] = {
        { "no adapter", kNone, true, detaching.c_str(), -1, { "No dongle. Stop restarting bluetoothd..." } },
        { "a link for a marker", kLink, true, detaching.c_str(), -1, { "No dongle. Stop restarting bluetoothd..." } },
        { "a daemon running", kFile, true, detaching.c_str(), 0, {} },
        { "none running", kFile, false, detaching.c_str(), 0, {} },
        { "a daemon that does not come up", kFile, false, "exit 1\n", -1, { "Failed to start bluetoothd" } },
        { "no daemon program", kFile, false, nullptr, -1, { "Failed to start bluetoothd" } },
    };
    for (const auto& row : kCases) {
        SCOPED_TRACE(row.name);
        const bool attached = row.marker == kFile;
        for (const char* path : { starts, "/tmp/bluetooth.info_hci0", "/usr/sbin/bluetoothd" }) unlink(path);
        if (attached) std::ofstream("/tmp/bluetooth.info_hci0") << "";
        if (row.marker == kLink) ASSERT_EQ(symlink("/etc/hostname", "/tmp/bluetooth.info_hci0"), 0);
        if (row.program != nullptr)
            std::ofstream("/usr/sbin/bluetoothd") << "#!/bin/sh\nprintf x >> " << starts << "\n" << row.program;
        chmod("/usr/sbin/bluetoothd", 0755);
        pid_t old = row.running ? btbus_test::spawn({ daemonCopy, "60" }) : -1;
        ASSERT_TRUE(!row.running || btbus_test::waitUntil([&] { return findProcessId("bluetoothd") == old; }));
        LogCapture log;
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(restartBluetoothd(), row.result);
        auto took = std::chrono::steady_clock::now() - start;
        EXPECT_EQ(log.from("commandlib.cpp"), row.log);
        EXPECT_EQ(std::filesystem::exists(starts) ? std::filesystem::file_size(starts) : 0u,
                  attached && row.program != nullptr ? 1u : 0u);
        EXPECT_EQ(took >= std::chrono::seconds(1), row.running && attached);  // a second for the old one to go
        int status = 0;
        bool ended = row.running && waitpid(old, &status, WNOHANG) == old;
        EXPECT_EQ(ended, row.running && attached);  // killed only when an adapter is attached
        EXPECT_TRUE(!ended || (WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL));
        pid_t now = findProcessId("bluetoothd");
        EXPECT_EQ(now > 0 && now != old, row.result == 0);
        // Ours, or orphans handed to us, the namespace's first process.
        for (int pid; (pid = findProcessId(daemonCopy)) > 0; waitpid(pid, nullptr, 0)) kill(pid, SIGKILL);
    }
}

TEST(PrivateMounts, KeepTheTreesUnderTmpTheyRunFrom) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    // In this namespace only: a /tmp that holds a checkout, a build tree and a stray file, beside
    // the trees this test runs from if they lie under /tmp. Both trees stay reachable, nothing else.
    std::string why;
    ASSERT_TRUE(btbus_test::privateTmp({ BTBUS_SOURCE_DIR, BTBUS_TEST_TMP, "/proc/self/exe" }, why)) << why;
    for (const char* tree : { "/tmp/checkout", "/tmp/build" }) mkdir(tree, 0755);
    ASSERT_EQ(mount(BTBUS_SOURCE_DIR, "/tmp/checkout", nullptr, MS_BIND, nullptr), 0);
    ASSERT_EQ(mount((std::string(BTBUS_TEST_TMP) + "/..").c_str(), "/tmp/build", nullptr, MS_BIND, nullptr), 0);
    std::ofstream("/tmp/stray") << "";
    const std::string scratch = "/tmp/build/test-tmp/private-mounts";
    mkdir(scratch.c_str(), 0755);

    // The script, as the demo and btbusctl's tests run it from the checkout.
    EXPECT_EQ(std::system(("cd / && TMPDIR=/tmp/build/test-tmp /tmp/checkout/scripts/in-private-mounts.sh " + scratch +
                           " sh -c 'ls /tmp; test \"$(echo $(ls /tmp))\" = \"build checkout\" &&"
                           " test -r /tmp/checkout/README.md && touch /etc/bluetooth/x'").c_str()), 0);

    // The tests' own helper, kept to what a test runs from.
    ASSERT_TRUE(btbus_test::privateTmp({ "/tmp/checkout/scripts", "/tmp/build/test-tmp" }, why)) << why;
    std::set<std::string> entries;
    for (const auto& entry : std::filesystem::directory_iterator("/tmp")) entries.insert(entry.path().filename());
    EXPECT_EQ(entries, (std::set<std::string>{ "build", "checkout" }));
    EXPECT_TRUE(std::ifstream("/tmp/checkout/README.md").good());
}

}  // namespace
