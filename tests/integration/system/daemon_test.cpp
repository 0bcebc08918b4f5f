// restartBluetoothd and its process search, with stand-ins for bluetoothd in a
// private namespace: /proc shows only this test's processes, /tmp and
// /usr/sbin are its own.
#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <bluetooth/util.h>

#include "support/log_capture.h"
#include "support/namespace.h"
#include "support/process.h"
#include "util/commandlib.h"

namespace {

using btbus_test::LogCapture;
using Lines = std::vector<std::string>;
using Bluetooth::internal::findProcessId;

// A copy of sleep at a path that names bluetoothd: what the search sees.
const char kDaemonCopy[] = "/tmp/bin/bluetoothd";
const char kStarts[] = "/tmp/starts";

void killDaemons() {
    for (int pid; (pid = findProcessId(kDaemonCopy)) > 0;) {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);  // ours, or an orphan handed to us, the namespace's first process
    }
}

// Each start of the stand-in adds a byte.
int starts() { return std::filesystem::exists(kStarts) ? std::filesystem::file_size(kStarts) : 0; }

TEST(RestartingBluetoothd, NeedsAnAttachedAdapterAndKillsTheOldDaemon) {
    BTBUS_IN_PRIVATE_NAMESPACE();
    std::string why;
    ASSERT_TRUE(btbus_test::privateSystemDirectories(why)) << why;
    mkdir("/tmp/bin", 0755);
    std::filesystem::copy_file("/bin/sleep", kDaemonCopy);
    // Like bluetoothd, it leaves its daemon running under its own name when it exits.
    const std::string detaching = std::string(kDaemonCopy) + " 60 &\nuntil [ \"$(readlink /proc/$!/exe)\" = " +
                                  kDaemonCopy + " ]; do :; done\n";
    const std::string failing = "exit 1\n";
    const struct {
        const char* name;
        bool attached, running;
        const std::string* program;  // null: no /usr/sbin/bluetoothd
        int result;
        Lines log;
    } kCases[] = {
        { "no adapter", false, true, &detaching, -1, { "No dongle. Stop restarting bluetoothd..." } },
        { "a daemon running", true, true, &detaching, 0, {} },
        { "none running", true, false, &detaching, 0, {} },
        { "a daemon that does not come up", true, false, &failing, -1, { "Failed to start bluetoothd" } },
        { "no daemon program", true, false, nullptr, -1, { "Failed to start bluetoothd" } },
    };
    for (const auto& row : kCases) {
        SCOPED_TRACE(row.name);
        unlink(kStarts);
        unlink("/tmp/bluetooth.info_hci0");
        if (row.attached) std::ofstream("/tmp/bluetooth.info_hci0") << "";
        unlink("/usr/sbin/bluetoothd");
        if (row.program != nullptr) {
            std::ofstream("/usr/sbin/bluetoothd") << "#!/bin/sh\nprintf x >> " << kStarts << "\n" << *row.program;
            chmod("/usr/sbin/bluetoothd", 0755);
        }
        pid_t old = row.running ? btbus_test::spawn({ kDaemonCopy, "60" }) : -1;
        ASSERT_TRUE(!row.running || btbus_test::waitUntil([&] { return findProcessId("bluetoothd") == old; }));
        LogCapture log;
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(Bluetooth::restartBluetoothd(), row.result);
        auto took = std::chrono::steady_clock::now() - start;
        EXPECT_EQ(log.from("commandlib.cpp"), row.log);
        EXPECT_EQ(starts(), row.attached && row.program != nullptr ? 1 : 0);
        if (row.running) {
            int status = 0;
            bool ended = waitpid(old, &status, WNOHANG) == old;
            EXPECT_EQ(ended, row.attached);  // killed only when an adapter is attached
            EXPECT_TRUE(!ended || (WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL));
            EXPECT_EQ(took >= std::chrono::seconds(1), row.attached);  // a second for the old one to go
        } else {
            EXPECT_LT(took, std::chrono::seconds(1));
        }
        int now = findProcessId("bluetoothd");
        EXPECT_EQ(now > 0 && now != old, row.result == 0);
        killDaemons();
    }
    // A link, which another user could plant in /tmp, marks no adapter.
    unlink("/tmp/bluetooth.info_hci0");
    ASSERT_EQ(symlink("/etc/hostname", "/tmp/bluetooth.info_hci0"), 0);
    LogCapture log;
    EXPECT_EQ(Bluetooth::restartBluetoothd(), -1);
    EXPECT_EQ(log.from("commandlib.cpp"), Lines{ "No dongle. Stop restarting bluetoothd..." });
}

}  // namespace
