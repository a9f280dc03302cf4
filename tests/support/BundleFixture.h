// BundleFixture: makes bundle trees (apps, their plug-ins, loose bundles) in a private temporary
// directory that disappears with the fixture. Every path it returns is canonical.
#pragma once

#include <string>
#include <string_view>

#include "platform/Value.h"

namespace om::test {

class BundleFixture {
public:
    enum class Form : uint8_t { Xml, Binary };

    BundleFixture();
    ~BundleFixture();
    BundleFixture(const BundleFixture&) = delete;
    BundleFixture& operator=(const BundleFixture&) = delete;

    const std::string& root() const { return m_root; }

    // An Info dictionary: identifier and executable name, plus extra keys (later ones win).
    static Value appInfo(std::string_view identifier, std::string_view executable, const Value& extra = Value());
    // A plug-in's Info dictionary: appInfo plus a "QSExtension" dictionary naming the extension
    // point, with the given attributes when not none.
    static Value plugInInfo(std::string_view identifier, std::string_view executable, std::string_view extensionPoint,
        const Value& attributes = Value());

    // <root>/<relativePath> with Info.vlist holding info; when info names VBBundleExecutable that
    // file is made too (a shell script that exits 0). Returns the bundle's path.
    std::string makeBundle(std::string_view relativePath, const Value& info, Form form = Form::Xml);
    // <root>/<name>.app
    std::string makeApp(std::string_view name, std::string_view identifier);
    // <appPath>/PlugIns/<name>.appex, a plug-in of extensionPoint.
    std::string makePlugIn(
        std::string_view appPath, std::string_view name, std::string_view identifier, std::string_view extensionPoint);

    // Writes a file under the root (directories made as needed); returns its path.
    std::string writeFile(std::string_view relativePath, std::string_view contents, unsigned mode = 0644);
    // Writes a file at an absolute path inside the root.
    static void writeFileAt(const std::string& path, std::string_view contents, unsigned mode = 0644);
    std::string makeDirectory(std::string_view relativePath);

private:
    std::string m_root;
};

} // namespace om::test
