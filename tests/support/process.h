#ifndef BTBUS_TESTS_SUPPORT_PROCESS_H
#define BTBUS_TESTS_SUPPORT_PROCESS_H

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include <dbus/dbus.h>
#include <sys/types.h>

namespace btbus_test {

using namespace std::chrono_literals;

// Debian's interpreter, which sees python3-dbus and python3-dbusmock; the
// python3 first on PATH may not.
constexpr const char* kDebianPython = "/usr/bin/python3";

// In a cross-built run, programs built for the target run through an
// emulator (BTBUS_TEST_EMULATOR: its words, separated by blanks), and every
// deadline stretches by BTBUS_TEST_TIME_SCALE; natively these change nothing.
// argv of a program built for the target, as this machine starts it.
std::vector<std::string> targetCommand(std::vector<std::string> argv);
// The same as one line for a shell.
std::string targetShellCommand(const std::string& program);
// A deadline or a duration a test expects, stretched for an emulated run.
std::chrono::milliseconds scaled(std::chrono::milliseconds duration);

// Starts argv[0] (looked up on PATH) with argv; its standard output goes to a
// pipe whose read end is stored in *stdoutFd when that is given. Fails the
// current test and returns -1 if it cannot be started.
pid_t spawn(const std::vector<std::string>& argv, int* stdoutFd = nullptr);

// Sends signal to pid and reaps it, escalating to SIGKILL after grace.
// Returns the wait status, or -1 if pid was not a child.
int stop(pid_t pid, int signal = 15, std::chrono::milliseconds grace = 3000ms);

// Reads one line from fd, waiting at most deadline; "" on time-out or end.
std::string readLine(int fd, std::chrono::milliseconds deadline);

// Polls predicate every 5 ms until it holds or deadline (scaled) passes.
bool waitUntil(const std::function<bool()>& predicate, std::chrono::milliseconds deadline = 3000ms);

// Whether name has an owner on the bus, asked through a private connection so
// that the library's shared connection is not touched.
bool nameHasOwner(DBusBusType bus, const std::string& name);
bool waitForName(DBusBusType bus, const std::string& name,
                 std::chrono::milliseconds deadline = 10000ms);

// Fails the test with a clear message when Debian's python3-dbusmock cannot be
// imported by /usr/bin/python3.
void requireDbusmock();

// What command, a line for /bin/sh, prints on its standard output and error.
std::string shell(const std::string& command);

// A directory for this test binary's files under the build tree's test-tmp.
std::string scratchDir();

// The test this process was started to run by inOwnProcess, "" in the parent.
std::string childRole();
// Whether this process runs the current test in a child of its own. In the
// parent it runs this test binary again with only this test, behind wrapper
// (e.g. {"unshare", "-m"}), expects it to pass and returns false. The child
// starts its own private buses.
bool inOwnProcess(const std::vector<std::string>& wrapper = {});

}  // namespace btbus_test

// The rest of the test runs in a fresh process of its own (see inOwnProcess).
#define BTBUS_IN_OWN_PROCESS() do { if (!::btbus_test::inOwnProcess()) return; } while (0)

#endif
