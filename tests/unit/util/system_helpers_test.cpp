// Named pipes, PID files and the HCI helpers, on files under the build tree.
#include <cstdlib>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <bluetooth/fifo.h>
#include <bluetooth/util.h>

#include "support/log_capture.h"
#include "support/process.h"

using namespace Bluetooth;
using btbus_test::LogCapture;
using Lines = std::vector<std::string>;

namespace {

std::string contentOf(const std::string& path) {
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

TEST(AFifo, CarriesBytesOneWayAndReportsWhatGoesWrong) {
    std::string path = btbus_test::scratchDir() + "/fifo";
    // No reader (its log line is checked with the auto-connect commands), but the pipe is made.
    EXPECT_EQ(Fifo::getWriteFifo(path.c_str()), nullptr);
    struct stat info;
    ASSERT_EQ(stat(path.c_str(), &info), 0);
    EXPECT_TRUE(S_ISFIFO(info.st_mode));

    int reader = open(path.c_str(), O_RDONLY | O_NONBLOCK);
    std::unique_ptr<Fifo> writer(Fifo::getWriteFifo(path.c_str()));
    ASSERT_NE(writer, nullptr);
    EXPECT_EQ(writer->writeData("", 0), 0);
    EXPECT_EQ(writer->writeData(nullptr, 1), -1);
    char bytes[16] = {};
    std::unique_ptr<Fifo> readBack(Fifo::getReadFifo(path.c_str()));  // a writer is there: no wait
    ASSERT_NE(readBack, nullptr);
    ASSERT_EQ(writer->writeData("1", 1), 0);
    EXPECT_EQ(readBack->readData(bytes, sizeof bytes), 0);
    EXPECT_EQ(bytes[0], '1');
    LogCapture log;
    // A full pipe fails the write at once; so does a pipe whose readers have gone.
    std::string big(1 << 20, 'x');
    EXPECT_EQ(writer->writeData(big.data(), static_cast<int>(big.size())), -1);
    close(reader);
    readBack.reset();
    EXPECT_EQ(writer->writeData("1", 1), -1);
    EXPECT_EQ(log.from("fifo.cpp"), Lines(2, "Error writing the data to the pipe file."));
    writer.reset();

    // No place for a pipe fails, and a link is not followed; a regular file is
    // opened as it is, and no program started later inherits it.
    log.clear();
    std::string link = path + "-link";
    ASSERT_EQ(symlink(path.c_str(), link.c_str()), 0);
    EXPECT_EQ(Fifo::getReadFifo(link.c_str()), nullptr);
    EXPECT_EQ(Fifo::getReadFifo((path + "/below").c_str()), nullptr);
    EXPECT_EQ(Fifo::getWriteFifo(nullptr), nullptr);
    EXPECT_EQ(log.from("fifo.cpp"), (Lines{ "Error opening the named file.", "Error opening the named file.",
                                         "Error opening the named file (null), errno is 22.",
                                         "Error opening the named file." }));
    std::string plain = btbus_test::scratchDir() + "/plain";
    std::ofstream(plain) << "";
    std::unique_ptr<Fifo> file(Fifo::getReadFifo(plain.c_str()));
    ASSERT_NE(file, nullptr);
    EXPECT_EQ(file->readData(bytes, sizeof bytes), 0);  // end of file
    EXPECT_EQ(system(("exec 2>/dev/null; ls -l /proc/self/fd | grep -q " + plain).c_str()), 256);
}

TEST(APidFile, LocksOutASecondProcessAndKeepsItsId) {
    std::string path = btbus_test::scratchDir() + "/daemon.pid";
    std::ofstream(path) << "123456789012\n";  // left by a process that died
    int held[2], release[2];
    ASSERT_EQ(pipe(held) | pipe(release), 0);
    pid_t holder = fork();
    if (holder == 0) {  // the first instance: holds the lock until told, or until the test ends
        close(release[1]);
        char byte = createPidFile(path.c_str(), 1, true) >= 0 ? 'y' : 'n';
        (void)!write(held[1], &byte, 1);
        (void)!read(release[0], &byte, 1);
        _exit(0);
    }
    char byte = 0;
    ASSERT_EQ(read(held[0], &byte, 1), 1);
    ASSERT_EQ(byte, 'y');
    for (bool reportRunning : { true, false }) {
        LogCapture log;
        EXPECT_EQ(createPidFile(path.c_str(), 0, reportRunning), -1);
        EXPECT_EQ(contentOf(path), std::to_string(holder) + "\n");
        EXPECT_EQ(log.from("auto_connect.cpp"),
                  reportRunning ? Lines{ "PID file '" + path + "' is locked; Daemon is already running" } : Lines{});
    }
    close(release[1]);
    waitpid(holder, nullptr, 0);
    for (int fd : { held[0], held[1], release[0] }) close(fd);
    // The holder has gone: taken over, and inherited across exec only without bit 0.
    for (int flags : { 0, 1, 2 }) {
        int fd = createPidFile(path.c_str(), flags, true);
        ASSERT_GE(fd, 0);
        EXPECT_EQ(contentOf(path), std::to_string(getpid()) + "\n");
        pid_t probe = btbus_test::spawn({ "sh", "-c", "exec test -e /proc/self/fd/" + std::to_string(fd) });
        int status = btbus_test::stop(probe, 0, std::chrono::seconds(10));
        EXPECT_EQ(WEXITSTATUS(status), (flags & 1) ? 1 : 0) << "flags " << flags;
        close(fd);
    }
    // Neither a directory nor a link, which could send the id anywhere.
    std::string link = path + "-link";
    ASSERT_EQ(symlink(path.c_str(), link.c_str()), 0);
    LogCapture log;
    EXPECT_EQ(createPidFile(btbus_test::scratchDir().c_str(), 0, true), -1);
    EXPECT_EQ(createPidFile(link.c_str(), 0, true), -1);
    EXPECT_EQ(log.from("auto_connect.cpp"),
              (Lines{ "Could not open PID file " + btbus_test::scratchDir(), "Could not open PID file " + link }));
}

TEST(TheHciHelpers, TakeAddressesFromPathsAndFailCleanlyWithoutARadio) {
    const struct { const char* path; const char* address; } kPaths[] = {
        { "/org/bluez/1/hci0/dev_00_11_22_33_44_55", "00:11:22:33:44:55" },
        { "/org/bluez/1/hci0/dev_", "" },
        { "/org/bluez/1/hci0/dev_00_11/fd_0", "00:11/fd:0" },  // the tail is kept
        { "dev_a_dev_b", "a:dev:b" },
        { "/org/bluez/1/hci0", nullptr },
        { nullptr, nullptr },
    };
    for (const auto& row : kPaths) {
        std::unique_ptr<char, decltype(&free)> address(getAddressFromPath(row.path), &free);
        EXPECT_EQ(address ? std::string(address.get()) : "<null>", row.address ? row.address : "<null>")
            << (row.path ? row.path : "<null>");
    }
    // Each fails before or at the HCI socket (this machine has no radio), leaving the buffer as it was.
    const struct { const char* address; int length; } kRequests[] = {
        { nullptr, 16 }, { "00:11:22:33:44:55", 0 }, { "00:11:22:33:44:55", -1 }, { "00:11:22:33:44:55", 16 },
    };
    for (const auto& row : kRequests) {
        char name[16] = "untouched";
        EXPECT_EQ(getNameFromAddr(row.address, name, row.length, GET_NAME_TIMEOUT_SHORT), -1);
        EXPECT_STREQ(name, "untouched");
    }
    EXPECT_EQ(getNameFromAddr("00:11:22:33:44:55", nullptr, 16, GET_NAME_TIMEOUT_SHORT), -1);
}

}  // namespace
