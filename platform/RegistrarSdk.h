// SDK entries of extension points: for each extension point a dictionary laid out like a bundle's
// Info.vlist, whose declarations complete those of every plug-in of that point. An entry is the
// vlist file <directory>/<extension point identifier>.vlist (either form).
#pragma once

#include <string>
#include <string_view>

#include "platform/Value.h"

namespace om {

class RegistrarSdk {
public:
    // REGISTRAR_SDK_DIR, else /usr/share/omd/sdk: SDK entries are installed with the system, for
    // every user alike.
    static std::string directory();
    // The entry of extensionPointIdentifier in directory: a dictionary, or none when there is no
    // such file, it does not parse or is not a dictionary, or the identifier cannot name a file.
    static Value read(const std::string& directory, std::string_view extensionPointIdentifier);
    // read() in directory().
    static Value read(std::string_view extensionPointIdentifier);
};

} // namespace om
