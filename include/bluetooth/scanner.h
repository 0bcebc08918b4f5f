#ifndef BTBUS_BLUETOOTH_SCANNER_H
#define BTBUS_BLUETOOTH_SCANNER_H

#include <string>
#include <utility>
#include <vector>

#include <bluetooth/remote_object.h>
#include <bluetooth/variant.h>

namespace Bluetooth {

/// Client of the scanner service ("com.quillmar.bluetooth" at "/" on the session
/// bus; see ScannerServer). A call with no service running starts one through
/// bus activation. Both operations first check with BlueZ that the adapter
/// exists, and send nothing when it does not.
class Scanner : public RemoteObject {
public:
    Scanner();
    virtual ~Scanner();

    /// Asks the service to drop adapter's finder, without waiting for its
    /// answer: true once the request is queued. Failures are logged.
    bool removeFinder(const char* adapter);
    /// The devices of adapter's finder (starting it on first use), in the
    /// answer's order: address and its properties, every value a string. The
    /// caller owns the list and every Dict in it. Entries whose text holds no
    /// ";" are left out, so a finder without devices gives an empty list. Null
    /// on failure; a service error arrives as error 11 with its text, logged
    /// when logError is true.
    std::vector<std::pair<std::string, Dict*> >* listDevices(const char* adapter, bool logError);
};

}  // namespace Bluetooth

#endif
