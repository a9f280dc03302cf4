#include "platform/RegistrarSdk.h"

#include "platform/Storage.h"
#include "platform/Vlist.h"

namespace om {

std::string RegistrarSdk::directory()
{
    return Storage::environment("REGISTRAR_SDK_DIR").value_or("/usr/share/omd/sdk");
}

Value RegistrarSdk::read(const std::string& directory, std::string_view extensionPointIdentifier)
{
    const std::string name = std::string(extensionPointIdentifier) + ".vlist";
    if (!Storage::isSafeComponent(extensionPointIdentifier) || !Storage::isSafeComponent(name))
        return {};
    auto entry = Vlist::readFile(directory + "/" + name);
    if (!entry.ok() || !entry->isDictionary())
        return {};
    return std::move(entry).releaseValue();
}

Value RegistrarSdk::read(std::string_view extensionPointIdentifier)
{
    return read(directory(), extensionPointIdentifier);
}

} // namespace om
