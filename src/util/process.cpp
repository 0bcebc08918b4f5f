#include "util/process.h"

#include <cerrno>
#include <csignal>
#include <ctime>

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace Bluetooth {
namespace internal {

namespace {

// Signals the caller blocks or ignores are not the program's business.
class CleanSignals {
public:
    CleanSignals() {
        posix_spawnattr_init(&attributes_);
        sigset_t none, all;
        sigemptyset(&none);
        sigfillset(&all);
        posix_spawnattr_setsigmask(&attributes_, &none);
        posix_spawnattr_setsigdefault(&attributes_, &all);
        posix_spawnattr_setflags(&attributes_, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    }
    ~CleanSignals() { posix_spawnattr_destroy(&attributes_); }
    const posix_spawnattr_t* get() const { return &attributes_; }

private:
    posix_spawnattr_t attributes_;
};

void sleepMilliseconds(long milliseconds) {
    struct timespec pause = { milliseconds / 1000, (milliseconds % 1000) * 1000000L };
    while (nanosleep(&pause, &pause) != 0 && errno == EINTR) {
    }
}

}  // namespace

Process::Process(const char* program, const char* const* argv, bool captureOutput)
    : pid_(-1), output_(0) {
    // posix_spawn may report a missing program only through the child's exit
    // status, too late to tell "cannot start" from "printed nothing".
    if (program == 0 || access(program, X_OK) != 0) return;
    int fds[2] = { -1, -1 };
    if (captureOutput && pipe2(fds, O_CLOEXEC) != 0) return;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    if (captureOutput) posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
    CleanSignals signals;
    pid_t pid = -1;
    int failed = posix_spawn(&pid, program, &actions, signals.get(), const_cast<char* const*>(argv),
                             environ);
    posix_spawn_file_actions_destroy(&actions);
    if (captureOutput) close(fds[1]);
    if (failed != 0) {
        if (captureOutput) close(fds[0]);
        return;
    }
    pid_ = pid;
    if (captureOutput) {
        output_ = fdopen(fds[0], "r");
        if (output_ == 0) close(fds[0]);
    }
}

Process::~Process() {
    // Closed first: a program still writing gets EPIPE instead of blocking.
    if (output_ != 0) fclose(output_);
    if (pid_ > 0 && !waitExit(kGraceMilliseconds)) {
        kill(pid_, SIGKILL);
        while (waitpid(pid_, 0, 0) < 0 && errno == EINTR) {
        }
    }
}

bool Process::waitExit(int milliseconds) {
    const long step = 5;
    for (long waited = 0; pid_ > 0; waited += step) {
        pid_t done = waitpid(pid_, 0, WNOHANG);
        if (done == pid_ || (done < 0 && errno != EINTR)) {
            pid_ = -1;  // reaped, or not ours to wait for
            break;
        }
        if (waited >= milliseconds) return false;
        sleepMilliseconds(step);
    }
    return true;
}

}  // namespace internal
}  // namespace Bluetooth
