#include "platform/RegistrarPlugInRecord.h"

namespace om {

RegistrarPlugInRecord::RegistrarPlugInRecord(Facts facts)
    : m_facts(std::move(facts))
{
}

Value RegistrarPlugInRecord::lookup(std::string_view key, RegistrarScope scope) const
{
    switch (scope) {
    case RegistrarScope::Info:
        return m_facts.infoDictionary[key];
    case RegistrarScope::PlugIn:
        return m_facts.plugInDictionary[key];
    case RegistrarScope::Attributes:
        break;
    }
    const Value& value = m_facts.plugInDictionary["QSExtensionAttributes"][key];
    if (value.isNone() && key == "QSExtensionPointIdentifier")
        return m_facts.plugInDictionary[key];
    return value;
}

std::string RegistrarPlugInRecord::description() const
{
    return "<RegistrarPlugInRecord " + m_facts.identifier.value_or("(no identifier)") + " " + m_facts.uuid.string()
        + " " + m_facts.bundlePath.value_or("(no path)") + ">";
}

} // namespace om
