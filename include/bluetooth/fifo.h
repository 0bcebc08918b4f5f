#ifndef BTBUS_BLUETOOTH_FIFO_H
#define BTBUS_BLUETOOTH_FIFO_H

namespace Bluetooth {

/// A one-direction channel over a named pipe. The object owns its descriptor
/// and closes it when deleted. Failures are logged.
class Fifo {
public:
    /// Creates the pipe at path (mode 0666 less the umask) unless something is
    /// there already, and opens it for reading; the open waits until a writer
    /// has the pipe open. A new Fifo owned by the caller, or null.
    static Fifo* getReadFifo(const char* path);
    /// The same for writing, without waiting: with no reader on the pipe it
    /// fails at once (ENXIO). The descriptor stays non-blocking, so a write into
    /// a full pipe fails. A new Fifo owned by the caller, or null.
    static Fifo* getWriteFifo(const char* path);

    /// Writes length bytes in one write call: 0 when all were written, -1
    /// otherwise (no open descriptor, null data, a negative length, a short or
    /// failed write, a reader that has gone).
    int writeData(const void* data, int length);
    /// One read call of up to length bytes into buffer: 0 when it did not fail,
    /// whatever it read (end of file included); -1 when it failed. The number
    /// of bytes read is not reported.
    int readData(void* buffer, int length);

    virtual ~Fifo();

protected:
    Fifo();

    int fd;  ///< -1 while no pipe is open

private:
    Fifo(const Fifo&) = delete;  ///< two owners would close twice
    Fifo& operator=(const Fifo&) = delete;
};

}  // namespace Bluetooth

#endif
