#include "tools/omctl/OmctlRegistrar.h"

#include <ostream>

#include "platform/Format.h"
#include "platform/Registrar.h"
#include "platform/RegistrarIndex.h"

namespace om {

const char* const OmctlRegistrar::kHelp = R"(usage: omctl [--json] registrar dump [--database FILE]

Lists what the Registrar has registered, read straight from its database
(read-only, so it works whether or not omd runs): each application with its
plug-ins, then the plug-ins that no application contains. Each plug-in shows
its UUID, identifier, version (QSExtensionVersion), extension point, bundle
path, data container and entitlements.

Options:
  -d, --database FILE   the Registrar database (default: REGISTRAR_DB, else
                        /var/lib/omd/registrar.db for root and
                        ${XDG_DATA_HOME:-~/.local/share}/omd/registrar.db otherwise)

Exit status: 0 success, 1 the database cannot be read, 2 usage error.
)";

namespace {

Value describe(const RegistrarPlugInRecord& record)
{
    DictionaryBuilder entry;
    entry.set("uuid", Value::uuid(record.uuid()));
    entry.set("identifier", record.identifier() ? Value(*record.identifier()) : Value());
    entry.set("version", record.lookup("QSExtensionVersion", RegistrarScope::Attributes));
    entry.set("extensionPoint", RegistrarIndex::extensionPointValue(record));
    entry.set("path", record.bundlePath() ? Value(*record.bundlePath()) : Value());
    entry.set("container", record.dataContainerPath() ? Value(*record.dataContainerPath()) : Value());
    entry.set("entitlements", record.entitlements().isNone() ? Value::dictionary({}) : record.entitlements());
    return entry.build();
}

Value dump(const RegistrarWorkspace& workspace)
{
    ArrayBuilder applications;
    for (const auto& application : workspace.allApplications()) {
        ArrayBuilder plugIns;
        for (const auto& record : workspace.plugInsOfApplication(application->path()))
            plugIns.append(describe(*record));
        DictionaryBuilder entry;
        entry.set("path", application->path());
        entry.set("identifier", application->bundleIdentifier() ? Value(*application->bundleIdentifier()) : Value());
        entry.set("name", application->displayName() ? Value(*application->displayName()) : Value());
        entry.set("placeholder", Value::boolean(application->isPlaceholder()));
        entry.set("plugIns", plugIns.build());
        applications.append(entry.build());
    }
    ArrayBuilder loose;
    for (const auto& record : workspace.allPlugIns()) {
        if (!record->containingApp())
            loose.append(describe(*record));
    }
    return Value::dictionary({
        { "database", Value(workspace.configuration().databasePath) },
        { "applications", applications.build() },
        { "plugIns", loose.build() },
    });
}

} // namespace

int OmctlRegistrar::registrar(OmctlContext& context, const std::vector<std::string>& arguments)
{
    if (arguments.empty() || arguments.front() != "dump")
        return context.usage(
            arguments.empty() ? "registrar: no action given (dump)" : "registrar: unknown action " + arguments.front());
    auto configuration = RegistrarWorkspace::Configuration::fromEnvironment();
    for (size_t index = 1; index < arguments.size(); ++index) {
        const std::string& argument = arguments[index];
        if (argument == "--database" || argument == "-d") {
            if (index + 1 >= arguments.size() || arguments[index + 1].empty())
                return context.usage("registrar: --database needs a file name");
            configuration.databasePath = arguments[++index];
        } else if (argument.starts_with("--database=") && argument.size() > 11) {
            configuration.databasePath = argument.substr(11);
        } else {
            return context.usage("registrar: unexpected argument " + argument);
        }
    }

    auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadOnly);
    if (!workspace.ok()) {
        context.err() << format("omctl: %s\n", workspace.error().localizedDescription());
        return kOmctlDaemonError; // the status of every failure that is not the command line's
    }
    context.print(dump(*workspace.value()));
    return kOmctlSuccess;
}

} // namespace om
