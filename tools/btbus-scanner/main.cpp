// btbus-scanner: hosts the scanner service on the session bus.
#include <cstdio>
#include <cstring>

#include <glib-unix.h>
#include <malloc.h>

#include <bluetooth/scanner_server.h>

namespace {

const char kUsage[] =
    "Usage: btbus-scanner [ADAPTER...]\n"
    "Serves com.quillmar.bluetooth on the session bus: other programs ask it which\n"
    "Bluetooth devices are around (com.quillmar.bluetooth.Scanner.ListDevices) and\n"
    "stop the discovery they started (RemoveFinder). Each ADAPTER (a name such as\n"
    "hci0, or an address) starts discovery at once.\n"
    "It exits with status 0 thirty seconds after the last discovery was started,\n"
    "or on SIGTERM or SIGINT; the bus starts it again on the next call.\n";

// GLib calls it only from the server's running loop.
gboolean quit(gpointer server) {
    (*static_cast<Bluetooth::ScannerServer**>(server))->quitLoop();
    return G_SOURCE_CONTINUE;
}

}  // namespace

int main(int argc, char** argv) {
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--help") == 0 || std::strcmp(argv[i], "-h") == 0) {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (argv[i][0] == '-') {
            std::fprintf(stderr, "btbus-scanner: unknown option %s\n%s", argv[i], kUsage);
            return 2;
        }
    }
    // A fixed threshold: the large buffers of an answer (a 10,000-device answer
    // is about 2 MB, built twice) go back to the system when freed, instead of
    // raising glibc's moving threshold and staying resident for the daemon's life.
    mallopt(M_MMAP_THRESHOLD, 128 * 1024);
    // Caught before the name is claimed: a stop asked for while the adapters
    // are set up ends the loop as soon as it runs.
    Bluetooth::ScannerServer* running = nullptr;
    guint term = g_unix_signal_add(SIGTERM, &quit, &running);
    guint interrupt = g_unix_signal_add(SIGINT, &quit, &running);
    Bluetooth::ScannerServer server;
    running = &server;
    for (int i = 1; i < argc; ++i) server.addAdapterFounder(argv[i]);
    server.startLoop();
    g_source_remove(term);
    g_source_remove(interrupt);
    return 0;
}
