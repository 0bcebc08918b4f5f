// An auto-connect file's content, read as the operations read it, against a
// plain model; and a list written as set() writes it, read back.
#include <sstream>

#include "autoconnect/config_text.h"
#include "fuzz.h"

using namespace Bluetooth::internal;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string content(reinterpret_cast<const char*>(data), size);
    // The flag as a stream reads a number, from before any embedded zero byte.
    std::istringstream in(content.c_str());
    long flag = 0, read = 0;
    bool number = static_cast<bool>(in >> flag) || (flag != 0 && in.fail());  // an overflow still read digits
    fuzz::require(leadingNumber(content, read) == number, "a leading number exactly when a stream reads one");
    fuzz::require(enabledFlag(content) == (number && flag == 1), "enabled exactly when the flag is 1");
    // The pieces after the flag and its comma, joined again, are the rest.
    std::vector<std::string> addresses = storedAddresses(content);
    std::string joined;
    for (size_t i = 0; i < addresses.size(); ++i) joined += (i ? "," : "") + addresses[i];
    std::string rest = content.size() > 2 ? content.substr(2) : "";
    if (!rest.empty() && rest.back() == ',') joined += ",";
    fuzz::require(joined == rest, "the pieces are the rest of the file");
    // A list of the input's comma-free pieces, written as set() writes it.
    std::vector<std::string> written;
    std::string file = "1";
    std::istringstream pieces(content);
    for (std::string piece; std::getline(pieces, piece, ',');)
        if (!piece.empty()) {
            written.push_back(piece);
            file += "," + piece;
        }
    fuzz::require(enabledFlag(file) && storedAddresses(file) == written, "a written list read back");
    return 0;
}
