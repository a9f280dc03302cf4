#include "platform/Bundle.h"

#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "platform/Vlist.h"

namespace om {

namespace fs = std::filesystem;

namespace {

constexpr std::string_view kInfoFile = "Info.vlist";
constexpr std::string_view kExecutableKey = "VBBundleExecutable";

std::optional<std::string> realPath(std::string_view path)
{
    if (path.empty() || path.find('\0') != std::string_view::npos)
        return std::nullopt;
    char* resolved = ::realpath(std::string(path).c_str(), nullptr);
    if (!resolved)
        return std::nullopt;
    std::string result(resolved);
    std::free(resolved);
    return result;
}

// Canonical form of a path whose last components may not exist (a deleted executable still has a
// place to look for its bundle).
std::optional<fs::path> weaklyCanonical(std::string_view path)
{
    if (path.empty() || path.find('\0') != std::string_view::npos)
        return std::nullopt;
    std::error_code error;
    fs::path absolute = fs::absolute(fs::path(path), error);
    if (error)
        return std::nullopt;
    fs::path canonical = fs::weakly_canonical(absolute, error);
    if (error)
        return std::nullopt;
    std::string text = canonical.string();
    while (text.size() > 1 && text.back() == '/')
        text.pop_back();
    return fs::path(text);
}

std::string infoPathOf(const std::string& directory)
{
    return directory == "/" ? "/" + std::string(kInfoFile) : directory + "/" + std::string(kInfoFile);
}

bool equal(const timespec& a, const timespec& b)
{
    return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

} // namespace

bool Bundle::FileStamp::operator==(const FileStamp& other) const
{
    return device == other.device && inode == other.inode && size == other.size && equal(modified, other.modified)
        && equal(changed, other.changed);
}

Bundle::Bundle(
    std::string requestedPath, std::optional<std::string> bundlePath, std::optional<std::string> supportFilesPath)
    : m_requestedPath(std::move(requestedPath))
    , m_bundlePath(std::move(bundlePath))
    , m_supportFilesPath(std::move(supportFilesPath))
{
}

std::optional<Bundle::FileStamp> Bundle::stampOf(const std::string& path)
{
    struct stat info;
    if (::stat(path.c_str(), &info) < 0 || !S_ISREG(info.st_mode))
        return std::nullopt;
    return FileStamp { .device = info.st_dev,
        .inode = info.st_ino,
        .size = info.st_size,
        .modified = info.st_mtim,
        .changed = info.st_ctim };
}

std::shared_ptr<const Bundle> Bundle::withCanonicalDirectory(std::string requestedPath, const std::string& directory)
{
    if (!stampOf(infoPathOf(directory)))
        return std::shared_ptr<const Bundle>(new Bundle(std::move(requestedPath), std::nullopt, std::nullopt));
    return std::shared_ptr<const Bundle>(new Bundle(std::move(requestedPath), directory, directory));
}

std::shared_ptr<const Bundle> Bundle::withPath(std::string_view path)
{
    auto directory = realPath(path);
    if (!directory)
        return std::shared_ptr<const Bundle>(new Bundle(std::string(path), std::nullopt, std::nullopt));
    return withCanonicalDirectory(std::string(path), *directory);
}

std::shared_ptr<const Bundle> Bundle::withDirectories(std::string_view bundlePath, std::string_view supportFilesPath)
{
    auto directory = realPath(bundlePath);
    auto support = realPath(supportFilesPath);
    if (!directory || !stampOf(infoPathOf(*directory)))
        return std::shared_ptr<const Bundle>(new Bundle(std::string(bundlePath), std::nullopt, std::nullopt));
    return std::shared_ptr<const Bundle>(new Bundle(std::string(bundlePath), *directory, support));
}

std::shared_ptr<const Bundle> Bundle::containingExecutable(std::string_view executablePath)
{
    auto target = weaklyCanonical(executablePath);
    if (!target)
        return std::shared_ptr<const Bundle>(new Bundle(std::string(executablePath), std::nullopt, std::nullopt));

    // Walk up to the root: an Info.vlist that names some other file (a helper tool inside an app,
    // say) does not claim this one, and an outer bundle still may.
    fs::path directory = target->parent_path();
    while (!directory.empty()) {
        if (stampOf(infoPathOf(directory.string()))) {
            auto candidate = withCanonicalDirectory(std::string(executablePath), directory.string());
            auto executable = candidate->executablePath();
            if (executable && weaklyCanonical(*executable) == *target)
                return candidate;
        }
        if (directory == directory.root_path())
            break;
        directory = directory.parent_path();
    }
    return std::shared_ptr<const Bundle>(new Bundle(std::string(executablePath), std::nullopt, std::nullopt));
}

std::shared_ptr<const Bundle> Bundle::mainBundle()
{
    // The running program's executable never changes, so neither does its bundle.
    static const std::shared_ptr<const Bundle> bundle = [] {
        std::error_code error;
        fs::path executable = fs::read_symlink("/proc/self/exe", error);
        if (error)
            return std::shared_ptr<const Bundle>(new Bundle("/proc/self/exe", std::nullopt, std::nullopt));
        return containingExecutable(executable.string());
    }();
    return bundle;
}

std::optional<std::string> Bundle::executablePath() const
{
    if (!m_bundlePath)
        return std::nullopt;
    const std::string* name = infoDictionary().stringFor(kExecutableKey);
    if (!name || name->empty() || name->find('\0') != std::string::npos)
        return std::nullopt;
    fs::path relative = fs::path(*name).lexically_normal();
    if (relative.is_absolute() || relative.empty() || relative == "." || *relative.begin() == "..")
        return std::nullopt;
    std::string text = (fs::path(*m_bundlePath) / relative).string();
    while (text.size() > 1 && text.back() == '/')
        text.pop_back();
    return text;
}

Value Bundle::infoDictionary() const
{
    if (!m_bundlePath)
        return {};
    std::string infoPath = infoPathOf(*m_bundlePath);

    std::lock_guard lock(m_infoMutex);
    auto before = stampOf(infoPath);
    if (!before) {
        m_infoStamp.reset();
        m_info = {};
        return {};
    }
    if (m_infoStamp && *m_infoStamp == *before)
        return m_info;

    auto parsed = Vlist::readFile(infoPath);
    m_info = parsed.ok() && parsed->isDictionary() ? parsed.value() : Value();
    // A file rewritten while we read it may have given us a mix; keep no stamp so that the next
    // call reads it again.
    auto after = stampOf(infoPath);
    if (after && *after == *before)
        m_infoStamp = before;
    else
        m_infoStamp.reset();
    return m_info;
}

std::string Bundle::description() const
{
    if (!m_bundlePath)
        return "<Bundle " + m_requestedPath + " (no bundle)>";
    if (m_supportFilesPath != m_bundlePath)
        return "<Bundle " + *m_bundlePath + " support=" + m_supportFilesPath.value_or("(none)") + ">";
    return "<Bundle " + *m_bundlePath + ">";
}

} // namespace om
