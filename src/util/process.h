#ifndef BTBUS_SRC_UTIL_PROCESS_H
#define BTBUS_SRC_UTIL_PROCESS_H

#include <cstdio>

#include <sys/types.h>

namespace Bluetooth {
namespace internal {

// A program started without a shell, owned by this object: unless released, it
// is reaped when the object goes, and killed if it has not ended by then.
class Process {
public:
    // How long a program whose output has been read may take to end by itself.
    enum { kGraceMilliseconds = 300 };

    // Starts program (a path: no shell, no PATH search) with argv (argv[0]
    // first, null-terminated), with an empty signal mask and default signal
    // actions. With captureOutput its standard output is read through output().
    Process(const char* program, const char* const* argv, bool captureOutput);
    // Closes the output, gives a running program kGraceMilliseconds to end, then
    // kills it (SIGKILL) and reaps it. Nothing for a released program.
    ~Process();

    // False when the program could not be started (missing, not executable).
    bool started() const { return pid_ > 0; }
    // The program's standard output; null when not captured or not started.
    FILE* output() const { return output_; }
    // Waits at most milliseconds for the program to end and reaps it. True
    // when it has ended (or was never started).
    bool waitExit(int milliseconds);
    // Leaves a running program alone for good: it is neither waited for nor
    // killed (a daemon that stays in the foreground).
    void release() { pid_ = -1; }

private:
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;

    pid_t pid_;
    FILE* output_;
};

}  // namespace internal
}  // namespace Bluetooth

#endif
