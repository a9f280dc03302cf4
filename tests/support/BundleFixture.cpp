#include "tests/support/BundleFixture.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "platform/Fatal.h"
#include "platform/Format.h"
#include "platform/Vlist.h"

namespace om::test {

namespace fs = std::filesystem;

namespace {

// A fixture that cannot make its files cannot run its test; stop with the reason.
[[noreturn]] void setupFailed(std::string_view what, const std::string& path)
{
    internalInconsistency(format("BundleFixture: %s %s: %s", what, path, std::strerror(errno)));
}

std::string joined(const std::string& directory, std::string_view relative)
{
    return (fs::path(directory) / fs::path(relative).relative_path()).lexically_normal().string();
}

} // namespace

BundleFixture::BundleFixture()
{
    const char* tmp = std::getenv("TMPDIR");
    std::string pattern = std::string(tmp && *tmp ? tmp : "/tmp") + "/omtest-bundles.XXXXXX";
    if (!::mkdtemp(pattern.data()))
        setupFailed("mkdtemp", pattern);
    char* canonical = ::realpath(pattern.c_str(), nullptr);
    if (!canonical)
        setupFailed("realpath", pattern);
    m_root = canonical;
    std::free(canonical);
}

BundleFixture::~BundleFixture()
{
    std::error_code error;
    // Tests may have left read-only or unwritable directories behind; give them back first.
    for (auto it = fs::recursive_directory_iterator(m_root, error); !error && it != fs::recursive_directory_iterator();
         it.increment(error)) {
        if (it->is_directory(error))
            fs::permissions(it->path(), fs::perms::owner_all, fs::perm_options::add, error);
    }
    fs::remove_all(m_root, error);
}

Value BundleFixture::appInfo(std::string_view identifier, std::string_view executable, const Value& extra)
{
    DictionaryBuilder info;
    info.set("VBBundleIdentifier", Value(identifier));
    if (!executable.empty())
        info.set("VBBundleExecutable", Value(executable));
    info.set("VBBundleVersion", "1");
    info.set("VBBundleShortVersionString", "1.0");
    for (const auto& [key, value] : extra.entries())
        info.set(key, value);
    return info.build();
}

Value BundleFixture::plugInInfo(
    std::string_view identifier, std::string_view executable, std::string_view extensionPoint, const Value& attributes)
{
    DictionaryBuilder extension;
    extension.set("QSExtensionPointIdentifier", Value(extensionPoint));
    if (!attributes.isNone())
        extension.set("QSExtensionAttributes", attributes);
    return appInfo(identifier, executable, Value::dictionary({ { "QSExtension", extension.build() } }));
}

std::string BundleFixture::makeDirectory(std::string_view relativePath)
{
    std::string path = joined(m_root, relativePath);
    std::error_code error;
    fs::create_directories(path, error);
    if (error) {
        errno = error.value();
        setupFailed("mkdir", path);
    }
    return path;
}

void BundleFixture::writeFileAt(const std::string& path, std::string_view contents, unsigned mode)
{
    std::error_code error;
    fs::create_directories(fs::path(path).parent_path(), error);
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0)
        setupFailed("open", path);
    size_t done = 0;
    while (done < contents.size()) {
        ssize_t n = ::write(fd, contents.data() + done, contents.size() - done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            setupFailed("write", path);
        done += static_cast<size_t>(n);
    }
    // Explicit, so that the umask does not decide what a test meant.
    if (::fchmod(fd, mode) < 0 || ::close(fd) < 0)
        setupFailed("fchmod", path);
}

std::string BundleFixture::writeFile(std::string_view relativePath, std::string_view contents, unsigned mode)
{
    std::string path = joined(m_root, relativePath);
    writeFileAt(path, contents, mode);
    return path;
}

std::string BundleFixture::makeBundle(std::string_view relativePath, const Value& info, Form form)
{
    std::string bundle = makeDirectory(relativePath);
    if (form == Form::Xml) {
        writeFileAt(bundle + "/Info.vlist", Vlist::writeXml(info));
    } else {
        auto bytes = Vlist::writeBinary(info);
        writeFileAt(
            bundle + "/Info.vlist", std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
    }
    if (const std::string* executable = info.stringFor("VBBundleExecutable")) {
        std::string path = joined(bundle, *executable);
        if (!fs::exists(path))
            writeFileAt(path, "#!/bin/sh\nexit 0\n", 0755);
    }
    return bundle;
}

std::string BundleFixture::makeApp(std::string_view name, std::string_view identifier)
{
    return makeBundle(std::string(name) + ".app", appInfo(identifier, name));
}

std::string BundleFixture::makePlugIn(
    std::string_view appPath, std::string_view name, std::string_view identifier, std::string_view extensionPoint)
{
    fs::path relative = fs::path(appPath).lexically_relative(m_root) / "PlugIns" / (std::string(name) + ".appex");
    return makeBundle(relative.string(), plugInInfo(identifier, name, extensionPoint));
}

} // namespace om::test
