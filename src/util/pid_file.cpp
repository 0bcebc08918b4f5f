#include <bluetooth/util.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include <fcntl.h>
#include <unistd.h>

#include "core/log.h"

// The PID file's log lines carry the auto-connect source's name, on purpose.
BT_LOG_FILE("auto_connect.cpp");

namespace Bluetooth {

namespace {

// Closes the descriptor and gives -1: every failure after the open.
int fail(int fd) {
    close(fd);
    return -1;
}

}  // namespace

// deliberate: the first two messages leave the path unquoted, and "Writing to
// PID file" is logged only on failure.
int createPidFile(const char* path, int flags, bool reportRunning) {
    // Not truncated yet: a refused lock must leave the other instance's id.
    // A symbolic link at path is refused: it could send the write anywhere.
    // Close-on-exec from the start when asked, so that no exec on another
    // thread inherits it meanwhile.
    int fd = path != 0 ? open(path, O_RDWR | O_CREAT | O_NOFOLLOW | ((flags & 1) ? O_CLOEXEC : 0), 0600) : -1;
    if (fd < 0) {
        BT_LOG_ERR("Could not open PID file %s", path != 0 ? path : "(null)");
        return -1;
    }
    if (flags & 1) {
        int descriptorFlags = fcntl(fd, F_GETFD);
        if (descriptorFlags < 0) {
            BT_LOG_ERR("Can not get flags for PID file %s", path);
            return fail(fd);
        }
        if (fcntl(fd, F_SETFD, descriptorFlags | FD_CLOEXEC) < 0) {
            BT_LOG_ERR("Could not set flags for PID file '%s'", path);
            return fail(fd);
        }
    }
    struct flock lock;
    memset(&lock, 0, sizeof lock);
    lock.l_type = F_WRLCK;
    lock.l_whence = SEEK_SET;
    lock.l_start = 0;
    lock.l_len = 0;  // to the end and beyond
    if (fcntl(fd, F_SETLK, &lock) < 0) {
        if (errno == EAGAIN || errno == EACCES) {
            if (reportRunning) BT_LOG_ERR("PID file '%s' is locked; Daemon is already running", path);
        } else {
            BT_LOG_ERR("Unable to lock PID file '%s'", path);
        }
        return fail(fd);
    }
    if (ftruncate(fd, 0) < 0) {
        BT_LOG_ERR("Could not truncate PID file '%s'", path);
        return fail(fd);
    }
    char text[32];
    int length = snprintf(text, sizeof text, "%ld\n", static_cast<long>(getpid()));
    if (write(fd, text, static_cast<size_t>(length)) != length) {
        BT_LOG_ERR("Writing to PID file '%s'", path);
        return fail(fd);
    }
    return fd;
}

}  // namespace Bluetooth
