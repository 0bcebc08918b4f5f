#include <bluetooth/fifo.h>

#include <cerrno>
#include <csignal>
#include <ctime>

#include <fcntl.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include "core/log.h"

BT_LOG_FILE("fifo.cpp");

namespace Bluetooth {

namespace {

// -1 with errno set on failure.
int openPipe(const char* path, int flags) {
    if (path == 0) {
        errno = EINVAL;
        return -1;
    }
    if (mkfifo(path, 0666) != 0 && errno != EEXIST) return -1;
    // A regular file already at path is opened as it is; a symbolic link, which
    // another user could have planted in /tmp, is not followed.
    return open(path, flags | O_NOFOLLOW | O_CLOEXEC);
}

// A write into a pipe whose reader has gone raises SIGPIPE, which would end the
// calling process: it is blocked on this thread for the write, and one that
// the write raised is taken back before the mask is restored.
ssize_t writeWithoutSigpipe(int fd, const void* data, size_t length) {
    sigset_t pipeOnly, previous, pending;
    sigemptyset(&pipeOnly);
    sigaddset(&pipeOnly, SIGPIPE);
    sigpending(&pending);
    bool alreadyPending = sigismember(&pending, SIGPIPE);
    pthread_sigmask(SIG_BLOCK, &pipeOnly, &previous);
    ssize_t written = write(fd, data, length);
    int error = errno;
    if (written < 0 && error == EPIPE && !alreadyPending) {
        struct timespec now = { 0, 0 };
        while (sigtimedwait(&pipeOnly, 0, &now) < 0 && errno == EINTR) {
        }
    }
    pthread_sigmask(SIG_SETMASK, &previous, 0);
    errno = error;
    return written;
}

}  // namespace

Fifo::Fifo() : fd(-1) {}

Fifo::~Fifo() {
    if (fd >= 0) close(fd);
}

Fifo* Fifo::getReadFifo(const char* path) {
    int descriptor = openPipe(path, O_RDONLY);
    if (descriptor < 0) {
        BT_LOG_ERR("Error opening the named file.");
        return 0;
    }
    Fifo* fifo = new Fifo;
    fifo->fd = descriptor;
    return fifo;
}

Fifo* Fifo::getWriteFifo(const char* path) {
    int descriptor = openPipe(path, O_WRONLY | O_NONBLOCK);
    if (descriptor < 0) {
        int error = errno;
        BT_LOG_ERR("Error opening the named file %s, errno is %d.", path != 0 ? path : "(null)", error);
        if (error != ENXIO) BT_LOG_ERR("Error opening the named file.");  // ENXIO: no reader yet
        return 0;
    }
    Fifo* fifo = new Fifo;
    fifo->fd = descriptor;
    return fifo;
}

int Fifo::writeData(const void* data, int length) {
    if (fd < 0 || data == 0 || length < 0) return -1;
    if (writeWithoutSigpipe(fd, data, static_cast<size_t>(length)) != length) {
        BT_LOG_ERR("Error writing the data to the pipe file.");
        return -1;
    }
    return 0;
}

// Unlike writeData, the buffer is not tested for null: deliberate.
int Fifo::readData(void* buffer, int length) {
    if (fd < 0) return -1;
    if (length < 0 || read(fd, buffer, static_cast<size_t>(length)) < 0) {
        BT_LOG_ERR("Error reading the data to the pipe file.");
        return -1;
    }
    return 0;
}

}  // namespace Bluetooth
