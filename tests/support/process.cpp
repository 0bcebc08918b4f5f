#include "support/process.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <sstream>
#include <thread>

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

extern char** environ;

namespace btbus_test {

namespace {

// argv0 as execvp would find it, resolved before the fork: the child of a
// threaded process may only make async-signal-safe calls.
std::string onPath(const std::string& argv0) {
    if (argv0.find('/') != std::string::npos) return argv0;
    const char* path = std::getenv("PATH");
    std::string dirs = path != nullptr ? path : "/usr/bin:/bin";
    for (size_t begin = 0; begin <= dirs.size();) {
        size_t end = dirs.find(':', begin);
        if (end == std::string::npos) end = dirs.size();
        std::string candidate = dirs.substr(begin, end - begin) + "/" + argv0;
        if (access(candidate.c_str(), X_OK) == 0) return candidate;
        begin = end + 1;
    }
    return argv0;
}

// argv as one line for /bin/sh, each word quoted.
std::string shellLine(const std::vector<std::string>& argv) {
    std::string line;
    for (const std::string& word : argv) {
        line += line.empty() ? "'" : " '";
        for (char c : word) {
            if (c == '\'') line += "'\\'";  // ends the quote, an escaped quote, quotes again
            line += c;
        }
        line += "'";
    }
    return line;
}

}  // namespace

std::vector<std::string> targetCommand(std::vector<std::string> argv) {
    const char* emulator = std::getenv("BTBUS_TEST_EMULATOR");
    std::istringstream words(emulator != nullptr ? emulator : "");
    std::vector<std::string> command{ std::istream_iterator<std::string>(words), {} };
    command.insert(command.end(), argv.begin(), argv.end());
    return command;
}

std::string targetShellCommand(const std::string& program) { return shellLine(targetCommand({ program })); }

std::chrono::milliseconds scaled(std::chrono::milliseconds duration) {
    const char* scale = std::getenv("BTBUS_TEST_TIME_SCALE");
    int factor = scale != nullptr ? std::atoi(scale) : 1;
    return duration * std::max(factor, 1);
}

// Forked rather than spawned so that the child is told to end when this
// process does, even by a crash: a crashed test leaves no daemon behind.
pid_t spawn(const std::vector<std::string>& argv, int* stdoutFd) {
    std::string program = onPath(argv[0]);
    std::vector<char*> args;
    for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
    args.push_back(nullptr);
    int out[2] = { -1, -1 };
    int failure[2] = { -1, -1 };  // the child's errno if it cannot exec
    if ((stdoutFd != nullptr && pipe2(out, O_CLOEXEC) != 0) || pipe2(failure, O_CLOEXEC) != 0) {
        ADD_FAILURE() << "pipe: " << strerror(errno);
        return -1;
    }
    pid_t parent = getpid();
    pid_t pid = fork();
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGTERM);
        if (getppid() != parent) _exit(127);  // already orphaned
        if (stdoutFd != nullptr) dup2(out[1], 1);
        execve(program.c_str(), args.data(), environ);
        int error = errno;
        ssize_t written = write(failure[1], &error, sizeof error);
        (void)written;
        _exit(127);
    }
    int error = pid < 0 ? errno : 0;
    close(failure[1]);
    if (pid > 0 && read(failure[0], &error, sizeof error) == static_cast<ssize_t>(sizeof error))
        waitpid(pid, nullptr, 0);  // an exec that succeeds closes the pipe unwritten: error stays 0
    close(failure[0]);
    if (stdoutFd != nullptr) {
        close(out[1]);
        *stdoutFd = out[0];
    }
    if (error != 0) {
        ADD_FAILURE() << "cannot start " << argv[0] << ": " << strerror(error);
        return -1;
    }
    return pid;
}

int stop(pid_t pid, int signal, std::chrono::milliseconds grace) {
    if (pid <= 0) return -1;
    kill(pid, signal);
    int status = 0;
    auto deadline = std::chrono::steady_clock::now() + scaled(grace);
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
    auto end = std::chrono::steady_clock::now() + scaled(deadline);
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
    auto end = std::chrono::steady_clock::now() + scaled(deadline);
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
    static const int status = std::system((std::string(kDebianPython) + " -c 'import dbusmock' 2>/dev/null").c_str());
    ASSERT_EQ(status, 0) << "python-dbusmock cannot be imported by " << kDebianPython
                         << ": install Debian's python3-dbusmock (apt-get install "
                            "python3-dbusmock), or run 'make check', which does";
}

std::string shell(const std::string& command) {
    std::string output;
    FILE* pipe = popen((command + " 2>&1").c_str(), "r");
    char buffer[4096];
    for (size_t n; pipe != nullptr && (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) output.append(buffer, n);
    if (pipe != nullptr) pclose(pipe);
    return output;
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

std::string childRole() {
    const char* role = std::getenv("BTBUS_CHILD");
    return role != nullptr ? role : "";
}

bool inOwnProcess(const std::vector<std::string>& wrapper) {
    const ::testing::TestInfo* test = ::testing::UnitTest::GetInstance()->current_test_info();
    std::string name = std::string(test->test_suite_name()) + "." + test->name();
    if (childRole() == name) return true;
    char self[4096];
    ssize_t length = readlink("/proc/self/exe", self, sizeof self);
    std::vector<std::string> argv = wrapper;
    for (const std::string& word : targetCommand({ std::string(self, length > 0 ? length : 0),
                                                   "--gtest_filter=" + name, "--gtest_color=no" }))
        argv.push_back(word);
    EXPECT_EQ(std::system(("BTBUS_CHILD=" + shellLine({ name }) + " " + shellLine(argv)).c_str()), 0)
        << "the test failed in its own process (its output is above)";
    return false;
}

}  // namespace btbus_test
