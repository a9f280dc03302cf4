#include "platform/Storage.h"

#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

#include "platform/UniqueFd.h"
#include "platform/Uuid.h"

namespace om {

namespace {

Result<void> writeAll(int fd, std::span<const uint8_t> bytes, const std::string& path)
{
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t written = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (written < 0 && errno == EINTR)
            continue;
        if (written < 0)
            return OMError::fromErrno("write " + path, errno);
        done += size_t(written);
    }
    return {};
}

std::string directoryOf(const std::string& path)
{
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos)
        return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

} // namespace

bool Storage::isMultiUser()
{
    return ::geteuid() != 0;
}

std::optional<std::string> Storage::environment(const char* name)
{
    const char* value = std::getenv(name); // NOLINT(concurrency-mt-unsafe): nothing here sets the environment
    if (!value || !*value)
        return std::nullopt;
    return std::string(value);
}

std::string Storage::homeDirectory()
{
    if (auto home = environment("HOME"))
        return *home;
    std::vector<char> buffer(4096);
    passwd entry {};
    passwd* found = nullptr;
    if (::getpwuid_r(::geteuid(), &entry, buffer.data(), buffer.size(), &found) == 0 && found && found->pw_dir)
        return found->pw_dir;
    return "/";
}

std::string Storage::dataHome()
{
    if (auto data = environment("XDG_DATA_HOME"))
        return *data;
    return homeDirectory() + "/.local/share";
}

std::string Storage::configHome()
{
    if (auto config = environment("XDG_CONFIG_HOME"))
        return *config;
    return homeDirectory() + "/.config";
}

std::string Storage::location(const char* name, std::string_view systemDefault, const std::string& userDefault)
{
    if (auto set = environment(name))
        return *set;
    return isMultiUser() ? userDefault : std::string(systemDefault);
}

std::string Storage::userDataContainer(std::string_view identifier)
{
    return dataHome() + "/omd/containers/" + std::string(identifier);
}

bool Storage::isSafeComponent(std::string_view text)
{
    return !text.empty() && text.size() <= 255 && text != "." && text != ".."
        && text.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

Result<std::string> Storage::canonicalPath(std::string_view path, size_t limit)
{
    if (path.find('\0') != std::string_view::npos)
        return OMError::fromErrno("realpath", EINVAL);
    char* resolved = ::realpath(std::string(path).c_str(), nullptr);
    if (!resolved)
        return OMError::fromErrno("realpath " + std::string(path), errno);
    std::string result(resolved);
    std::free(resolved);
    if (result.size() >= limit)
        return OMError::fromErrno("realpath " + std::string(path), ENAMETOOLONG);
    return result;
}

Result<void> Storage::makeDirectories(const std::string& path, unsigned mode)
{
    if (path.empty())
        return OMError::platform(kPlatformErrorUnsupported, "empty directory path");
    for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
        const std::string prefix = path.substr(0, slash);
        if (!prefix.empty() && ::mkdir(prefix.c_str(), mode) < 0 && errno != EEXIST)
            return OMError::fromErrno("mkdir " + prefix, errno);
        if (slash == std::string::npos)
            break;
    }
    struct stat info;
    if (::stat(path.c_str(), &info) < 0)
        return OMError::fromErrno("stat " + path, errno);
    if (!S_ISDIR(info.st_mode))
        return OMError::platform(kPlatformErrorUnsupported, path + " is not a directory");
    return {};
}

Result<void> Storage::writeFileAtomically(
    const std::string& path, std::span<const uint8_t> bytes, unsigned mode, Existing existing)
{
    const std::string directory = directoryOf(path);
    // Named apart from the file, so that a file name of the full 255 bytes still has room for it.
    const std::string temporary = directory + "/.tmp-" + Uuid::random().string();
    UniqueFd file(::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode));
    if (!file.valid())
        return OMError::fromErrno("open " + temporary, errno);
    auto fail = [&](const OMError& error) -> Result<void> {
        (void)::unlink(temporary.c_str()); // the old file is untouched; the partial copy goes
        return error;
    };
    if (auto written = writeAll(file.get(), bytes, temporary); !written.ok())
        return fail(written.error());
    if (::fsync(file.get()) < 0)
        return fail(OMError::fromErrno("fsync " + temporary, errno));
    file.reset();
    if (existing == Existing::Keep) {
        // link() never replaces: it fails with EEXIST where rename() would have taken the name.
        const int linked = ::link(temporary.c_str(), path.c_str());
        const int error = errno;
        (void)::unlink(temporary.c_str()); // the new file, if linked, lives on under path
        if (linked < 0)
            return OMError::fromErrno("link " + path, error);
    } else if (::rename(temporary.c_str(), path.c_str()) < 0) {
        return fail(OMError::fromErrno("rename " + temporary, errno));
    }
    UniqueFd parent(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!parent.valid())
        return OMError::fromErrno("open " + directory, errno);
    if (::fsync(parent.get()) < 0)
        return OMError::fromErrno("fsync " + directory, errno);
    return {};
}

Result<std::vector<uint8_t>> Storage::readFile(const std::string& path, size_t maxBytes, struct stat* status)
{
    // O_NONBLOCK so that a FIFO in the way cannot stall the open; regular files ignore it.
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (!fd.valid())
        return OMError::fromErrno("open " + path, errno);
    struct stat info { };
    if (::fstat(fd.get(), &info) != 0)
        return OMError::fromErrno("fstat " + path, errno);
    if (status)
        *status = info;
    auto tooLarge = [&] {
        return OMError::platform(kPlatformErrorLimit, path + ": larger than " + std::to_string(maxBytes) + " bytes");
    };
    if (!S_ISREG(info.st_mode))
        return OMError::platform(kPlatformErrorUnsupported, path + ": not a regular file");
    if (static_cast<uint64_t>(info.st_size) > maxBytes)
        return tooLarge();

    // Read to the end rather than to st_size: the file may change under us, and the limit holds
    // whatever it grows to.
    std::vector<uint8_t> bytes(std::min(static_cast<size_t>(info.st_size), maxBytes) + 1);
    size_t filled = 0;
    for (;;) {
        if (filled == bytes.size()) {
            if (bytes.size() > maxBytes)
                return tooLarge();
            bytes.resize(std::min(bytes.size() * 2, maxBytes + 1));
        }
        const ssize_t n = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return OMError::fromErrno("read " + path, errno);
        }
        if (n == 0)
            break;
        filled += static_cast<size_t>(n);
    }
    bytes.resize(filled);
    return bytes;
}

} // namespace om
