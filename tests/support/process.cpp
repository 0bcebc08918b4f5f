#include "support/process.h"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <thread>

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

extern char** environ;

namespace btbus_test {

pid_t spawn(const std::vector<std::string>& argv, int* stdoutFd) {
    std::vector<char*> args;
    for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
    args.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    int out[2] = { -1, -1 };
    if (stdoutFd != nullptr) {
        if (pipe2(out, O_CLOEXEC) != 0) {
            ADD_FAILURE() << "pipe: " << strerror(errno);
            return -1;
        }
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    }
    pid_t pid = -1;
    int rc = posix_spawnp(&pid, args[0], &actions, nullptr, args.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (stdoutFd != nullptr) {
        close(out[1]);
        *stdoutFd = out[0];
    }
    if (rc != 0) {
        ADD_FAILURE() << "cannot start " << argv[0] << ": " << strerror(rc);
        return -1;
    }
    return pid;
}

int stop(pid_t pid, int signal, std::chrono::milliseconds grace) {
    if (pid <= 0) return -1;
    kill(pid, signal);
    int status = 0;
    auto deadline = std::chrono::steady_clock::now() + grace;
    while (std::chrono::steady_clock::now() < deadline) {
        pid_t done = waitpid(pid, &status, WNOHANG);
        if (done == pid) return status;
        if (done < 0) return -1;
        std::this_thread::sleep_for(5ms);
    }
    kill(pid, SIGKILL);
    return waitpid(pid, &status, 0) == pid ? status : -1;
}

std::string readLine(int fd, std::chrono::milliseconds deadline) {
    std::string line;
    auto end = std::chrono::steady_clock::now() + deadline;
    while (std::chrono::steady_clock::now() < end) {
        struct pollfd p = { fd, POLLIN, 0 };
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            end - std::chrono::steady_clock::now());
        if (poll(&p, 1, static_cast<int>(std::max<long>(left.count(), 0))) <= 0) break;
        char c;
        if (read(fd, &c, 1) != 1) break;
        if (c == '\n') return line;
        line += c;
    }
    return "";
}

bool waitUntil(const std::function<bool()>& predicate, std::chrono::milliseconds deadline) {
    auto end = std::chrono::steady_clock::now() + deadline;
    while (true) {
        if (predicate()) return true;
        if (std::chrono::steady_clock::now() >= end) return false;
        std::this_thread::sleep_for(5ms);
    }
}

bool nameHasOwner(DBusBusType bus, const std::string& name) {
    DBusError error;
    dbus_error_init(&error);
    DBusConnection* connection = dbus_bus_get_private(bus, &error);
    dbus_error_free(&error);
    if (connection == nullptr) return false;
    dbus_connection_set_exit_on_disconnect(connection, FALSE);
    bool owned = dbus_bus_name_has_owner(connection, name.c_str(), &error);
    dbus_error_free(&error);
    dbus_connection_close(connection);
    dbus_connection_unref(connection);
    return owned;
}

bool waitForName(DBusBusType bus, const std::string& name, std::chrono::milliseconds deadline) {
    return waitUntil([&] { return nameHasOwner(bus, name); }, deadline);
}

void requireDbusmock() {
    static int status = -1;
    if (status < 0) {
        std::string command = std::string(kDebianPython) + " -c 'import dbusmock' 2>/dev/null";
        status = std::system(command.c_str());
    }
    ASSERT_EQ(status, 0) << "python-dbusmock cannot be imported by " << kDebianPython
                         << ": install Debian's python3-dbusmock (apt-get install "
                            "python3-dbusmock), or run 'make check', which does";
}

std::string scratchDir() {
    static std::string dir;
    if (dir.empty()) {
        // Not named by the pid alone: children in process namespaces of their
        // own share pids.
        std::string name = std::string(BTBUS_TEST_TMP) + "/run-" + std::to_string(getpid()) + "-XXXXXX";
        mkdir(BTBUS_TEST_TMP, 0755);
        if (mkdtemp(&name[0]) != nullptr) dir = name;
    }
    return dir;
}

}  // namespace btbus_test
