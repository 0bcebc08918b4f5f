// AutoConnect's files and commands, in a private namespace whose /etc/bluetooth
// and /tmp are its own, against bluez4-sim for the device lists.
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "support/log_capture.h"
#include "support/namespace.h"
#include "support/process.h"
#include "support/sim.h"

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

// What stands at path: its content, or a word for what is not a file.
std::string standing(const std::string& path) {
    struct stat info;
    if (lstat(path.c_str(), &info) != 0) return kMissing;
    if (S_ISDIR(info.st_mode) || S_ISLNK(info.st_mode)) return S_ISDIR(info.st_mode) ? "<directory>" : "<link>";
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

void writeFile(const std::string& path, const std::string& content) {
    mkdir(kDirectory, 0755);
    std::filesystem::remove_all(path);
    if (content != kMissing) std::ofstream(path) << content;
}

// The daemon's side of the pipe: what has arrived since the last call.
class PipeReader {
public:
    PipeReader() {
        mkfifo(kPipe, 0666);
        fd_ = open(kPipe, O_RDONLY | O_NONBLOCK);
    }
    ~PipeReader() { close(fd_); }
    std::string take() {
        std::string bytes;
        char buffer[4096];
        for (ssize_t n; (n = read(fd_, buffer, sizeof buffer)) > 0;) bytes.append(buffer, n);
        return bytes;
    }
    int fd_;
};

// In the namespace's child, the system directories are made private first.
class AutoConnectFiles : public ::testing::Test {
protected:
    void SetUp() override {
        std::string why;
        if (!btbus_test::childRole().empty()) ASSERT_TRUE(btbus_test::privateSystemDirectories(why)) << why;
    }
    AutoConnect config;
};

using Operation = std::function<bool(AutoConnect&)>;
Operation enabled(const char* adapter) { return [=](AutoConnect& c) { return c.getEnable(adapter); }; }
Operation set(const char* adapter, bool on, const char* list) {
    return [=](AutoConnect& c) { return c.set(adapter, on, list); };
}
Operation remove(const char* device) { return [=](AutoConnect& c) { return c.removeDevice(kAdapter, device); }; }
Operation send(bool (AutoConnect::*command)() const) { return [=](AutoConnect& c) { return (c.*command)(); }; }

TEST_F(AutoConnectFiles, HoldTheFlagAndTheListAndTellTheDaemon) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    std::string longList;
    for (int i = 0; i < 100000; ++i) longList += ",AA:BB:CC:" + std::to_string(100000 + i);
    const std::string notRegular = "Config '" + kFile + "' is not regular file.";
    const struct {
        std::string before;
        Operation operation;
        bool result;
        std::string after, command;
        Lines log;
    } kCases[] = {
        { kMissing, enabled(kAdapter), false, "0", "", {} },
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
    };
    PipeReader daemon;
    for (const auto& row : kCases) {
        SCOPED_TRACE(row.before.substr(0, 20));
        writeFile(kFile, row.before[0] == '<' ? kMissing : row.before);
        if (row.before == "<directory>") mkdir(kFile.c_str(), 0755);
        if (row.before == "<link>") symlink("/etc/bluetooth/nowhere", kFile.c_str());
        LogCapture log;
        EXPECT_EQ(row.operation(config), row.result);
        EXPECT_EQ(log.from("auto_connect.cpp"), row.log);
        EXPECT_EQ(standing(kFile), row.after);
        EXPECT_EQ(daemon.take(), row.command);
    }
    EXPECT_EQ(standing("/etc/bluetooth/nowhere"), kMissing);
    struct stat info;
    ASSERT_EQ(stat(kDirectory, &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0755u);
}

TEST_F(AutoConnectFiles, KeepTheOldListWhenTheDiskIsFull) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    mkdir(kDirectory, 0755);
    ASSERT_EQ(mount("tmpfs", kDirectory, "tmpfs", 0, "size=8k"), 0);
    writeFile(kFile, "1,A");
    PipeReader daemon;
    LogCapture log;
    EXPECT_FALSE(config.set(kAdapter, true, std::string(64 * 1024, ',').c_str()));
    EXPECT_EQ(log.from("auto_connect.cpp"), Lines{ "Can not write config file '" + kFile + "'." });
    EXPECT_EQ(standing(kFile), "1,A");
    EXPECT_EQ(daemon.take(), "");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(kDirectory), {}), 1) << "a new file left behind";
}

TEST_F(AutoConnectFiles, SendCommandsOnlyToADaemonThatReads) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    mkfifo(kPipe, 0666);  // nobody reads it
    LogCapture log;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(config.reload());
    EXPECT_FALSE(config.pause());
    EXPECT_FALSE(config.resume());
    EXPECT_LT(std::chrono::steady_clock::now() - start, btbus_test::scaled(std::chrono::seconds(1)));
    EXPECT_EQ(log.from("fifo.cpp"), Lines(3, std::string("Error opening the named file ") + kPipe + ", errno is 6."));
    EXPECT_TRUE(config.set(kAdapter, true, ",A"));  // the file still counts
    EXPECT_EQ(standing(kFile), "1,A");
}

Lines pathsOf(const DeviceList* devices) {
    Lines paths;
    for (Device* device : *devices) paths.push_back(device->getPath());
    return paths;
}

TEST_F(AutoConnectFiles, ListTheDevicesBluetoothdKnowsAndForgetTheOthers) {
    BTBUS_IN_PRIVATE_NAMESPACE();
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
        std::unique_ptr<DeviceList> devices(config.getDeviceList(hci0.c_str()));
        ASSERT_NE(devices, nullptr);
        EXPECT_EQ(pathsOf(devices.get()), (Lines{ mouse, other }));
        EXPECT_EQ(standing(kDirectory + hci0), flag == "1" ? std::string("1,") + sim::kMouse + ",00:11:22:AA:BB:CC" : flag + list0);
        EXPECT_EQ(log.from("adapter.cpp").size(), 1u) << "the unknown address, logged by the adapter";
    }
    LogCapture log;
    EXPECT_EQ(config.getDeviceList("00:00:00:00:00:99"), nullptr);
    EXPECT_EQ(log.from("auto_connect.cpp"), Lines{ "Failed to get adapter." });

    // Every powered adapter whose list is enabled.
    std::unique_ptr<Adapter> second(Adapter::getAdapter(hci1Path.c_str()));
    const struct { std::string flag0, flag1; bool powered1; Lines paths; } kCases[] = {
        { "1", "1", true, { mouse, other, onHci1 } },
        { "1", "1", false, { mouse, other } },
        { "0", "1", true, { onHci1 } },
    };
    for (const auto& row : kCases) {
        writeFile(kDirectory + hci0, row.flag0 + list0);
        writeFile(kDirectory + hci1, row.flag1 + list1);
        second->setProperty("Powered", Variant(row.powered1));
        ASSERT_TRUE(btbus_test::waitUntil([&] {
            std::unique_ptr<Dict> properties(second->BluezObject::getProperties());
            return find(properties.get(), "Powered") == (row.powered1 ? "1" : "0");
        }));
        std::unique_ptr<DeviceList> devices(config.getAutoConnectDeviceList());
        ASSERT_NE(devices, nullptr);
        EXPECT_EQ(pathsOf(devices.get()), row.paths);
        EXPECT_EQ(standing(kDirectory + hci1), row.powered1 ? "1,00:11:22:AA:BB:DD" : "1" + list1);
    }

    sim::kill();
    log.clear();
    EXPECT_EQ(config.getDeviceList(hci0.c_str()), nullptr);
    EXPECT_EQ(config.getAutoConnectDeviceList(), nullptr);
    EXPECT_EQ(log.from("auto_connect.cpp"), Lines(2, "Failed to get manager."));
}

}  // namespace
