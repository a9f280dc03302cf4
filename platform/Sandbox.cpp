#include "platform/Sandbox.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <mutex>
#include <optional>

#include "platform/Digest.h"
#include "platform/Storage.h"
#include "platform/UniqueFd.h"

namespace om {

namespace {

constexpr size_t kKeySize = 32;
using Key = std::array<uint8_t, kKeySize>;
constexpr size_t kMacHexSize = 2 * Digest::Sha256().size();
// Seconds since 1970 fit in 20 decimal digits for as long as a 64-bit count lasts.
constexpr size_t kMaxTimeDigits = 20;

OMError posixError(int code, std::string description)
{
    return OMError("POSIX", code, std::move(description));
}

std::span<const uint8_t> bytesOf(std::string_view text)
{
    return { reinterpret_cast<const uint8_t*>(text.data()), text.size() };
}

Result<void> fillRandom(std::span<uint8_t> bytes)
{
    size_t filled = 0;
    while (filled < bytes.size()) {
        const ssize_t n = ::getrandom(bytes.data() + filled, bytes.size() - filled, 0);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return OMError::fromErrno("getrandom", errno);
        filled += size_t(n);
    }
    return {};
}

// Racing first users each write a key of their own; exactly one lands, and the others use it.
Result<void> makeKey(const std::string& path)
{
    OM_TRY(Storage::makeDirectories(std::filesystem::path(path).parent_path()));
    Key key {};
    OM_TRY(fillRandom(key));
    auto made = Storage::writeFileAtomically(path, key, 0600, Storage::Existing::Keep);
    if (!made.ok() && !(made.error().domain() == "POSIX" && made.error().code() == EEXIST))
        return made.error();
    return {};
}

// A key anyone but its owner could read lets them forge tokens; one they could write lets them
// choose the key. Either is refused rather than used.
Result<Key> readKey(int fd, const std::string& path, struct stat& info)
{
    if (::fstat(fd, &info) < 0)
        return OMError::fromErrno("fstat " + path, errno);
    if (!S_ISREG(info.st_mode))
        return posixError(EINVAL, "sandbox key " + path + " is not a regular file");
    if ((info.st_mode & (S_IRWXG | S_IRWXO)) != 0)
        return posixError(EACCES, "sandbox key " + path + " is accessible to group or others");
    if (info.st_uid != ::geteuid())
        return posixError(EACCES, "sandbox key " + path + " belongs to another user");
    if (info.st_size != off_t(kKeySize))
        return posixError(EINVAL, "sandbox key " + path + " is not exactly 32 bytes");
    Key key {};
    size_t done = 0;
    while (done < key.size()) {
        const ssize_t n = ::pread(fd, key.data() + done, key.size() - done, off_t(done));
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return OMError::fromErrno("read " + path, errno);
        if (n == 0)
            return posixError(EINVAL, "sandbox key " + path + " is not exactly 32 bytes");
        done += size_t(n);
    }
    return key;
}

// The key last read, with what identified its file then. Issuing a token per plug-in of a large
// discovery reply made reading the file the most costly part of issuing; a stat tells whether the
// file is still the one read, and a change of owner or mode changes its ctime.
struct CachedKey {
    std::mutex mutex;
    std::string path;
    dev_t device = 0;
    ino_t inode = 0;
    timespec changed {};
    std::optional<Key> key;
};

CachedKey& cachedKey()
{
    static CachedKey cache;
    return cache;
}

bool sameFile(const CachedKey& cache, const std::string& path, const struct stat& info)
{
    return cache.key && cache.path == path && cache.device == info.st_dev && cache.inode == info.st_ino
        && cache.changed.tv_sec == info.st_ctim.tv_sec && cache.changed.tv_nsec == info.st_ctim.tv_nsec;
}

// info receives what identified the file read.
Result<Key> readKeyFile(const std::string& path, struct stat& info)
{
    // O_NONBLOCK: something other than a file planted at the key's path must not hang the caller.
    constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
    UniqueFd file(::open(path.c_str(), kFlags));
    if (!file.valid() && errno == ENOENT) {
        OM_TRY(makeKey(path));
        file.reset(::open(path.c_str(), kFlags));
    }
    if (!file.valid())
        return OMError::fromErrno("open " + path, errno);
    return readKey(file.get(), path, info);
}

Result<Key> loadKey()
{
    const std::string path = Sandbox::keyPath();
    CachedKey& cache = cachedKey();
    struct stat info;
    if (::stat(path.c_str(), &info) == 0) {
        std::lock_guard lock(cache.mutex);
        if (sameFile(cache, path, info))
            return *cache.key;
    }
    Key key = OM_TRY(readKeyFile(path, info));
    std::lock_guard lock(cache.mutex);
    cache.path = path;
    cache.device = info.st_dev;
    cache.inode = info.st_ino;
    cache.changed = info.st_ctim;
    cache.key = key;
    return key;
}

std::string hexOf(std::span<const uint8_t> bytes)
{
    static constexpr char kDigits[] = "0123456789abcdef";
    std::string text;
    text.reserve(bytes.size() * 2);
    for (uint8_t byte : bytes) {
        text += kDigits[byte >> 4];
        text += kDigits[byte & 0xf];
    }
    return text;
}

std::optional<Digest::Sha256> macOfHex(std::string_view text)
{
    auto nibble = [](char c) -> int {
        if (c >= '0' && c <= '9')
            return c - '0';
        if (c >= 'a' && c <= 'f')
            return c - 'a' + 10;
        return -1;
    };
    Digest::Sha256 mac {};
    if (text.size() != kMacHexSize)
        return std::nullopt;
    for (size_t i = 0; i < mac.size(); ++i) {
        const int high = nibble(text[2 * i]);
        const int low = nibble(text[2 * i + 1]);
        if (high < 0 || low < 0)
            return std::nullopt;
        mac[i] = uint8_t(high << 4 | low);
    }
    return mac;
}

// What the HMAC covers: every field of the token but the HMAC itself, in token order.
Digest::Sha256 macOf(const Key& key, std::string_view extensionClass, std::string_view time, std::string_view path)
{
    std::string covered;
    covered.reserve(extensionClass.size() + time.size() + path.size() + 2);
    covered.append(extensionClass).append(";").append(time).append(";").append(path);
    return Digest::hmacSha256(key, bytesOf(covered));
}

struct TokenFields {
    std::string_view extensionClass;
    std::string_view time;
    std::string_view mac;
    std::string_view path;
};

// Splits at the first three ';' only: the path is last so that it may hold any byte but NUL.
std::optional<TokenFields> fieldsOf(std::string_view token)
{
    TokenFields fields;
    std::string_view* leading[] = { &fields.extensionClass, &fields.time, &fields.mac };
    for (std::string_view* field : leading) {
        const size_t end = token.find(';');
        if (end == std::string_view::npos)
            return std::nullopt;
        *field = token.substr(0, end);
        token.remove_prefix(end + 1);
    }
    fields.path = token;
    const bool timeIsDecimal = !fields.time.empty() && fields.time.size() <= kMaxTimeDigits
        && fields.time.find_first_not_of("0123456789") == std::string_view::npos;
    if (fields.extensionClass != Sandbox::kReadOnlyFileClass || !timeIsDecimal || !fields.path.starts_with('/')
        || fields.path.find('\0') != std::string_view::npos)
        return std::nullopt;
    return fields;
}

} // namespace

std::string Sandbox::keyPath()
{
    return Storage::location("SANDBOX_KEY", "/var/lib/omd/sandbox.key", Storage::dataHome() + "/omd/sandbox.key");
}

Result<std::string> Sandbox::canonicalPath(std::string_view path)
{
    const std::string text(path);
    if (text.size() != path.size() || text.find('\0') != std::string::npos)
        return posixError(EINVAL, "path holds a NUL byte");
    // One walk by the kernel instead of realpath's lstat and readlink of every component (a
    // discovery reply issues a token per plug-in): the path is opened without access and read back
    // through /proc. Where /proc is missing, as in some sandboxes, realpath does it.
    UniqueFd opened(::open(text.c_str(), O_PATH | O_CLOEXEC));
    if (!opened.valid())
        return OMError::fromErrno("realpath " + text, errno);
    std::array<char, PATH_MAX + 1> link {};
    const std::string procPath = "/proc/self/fd/" + std::to_string(opened.get());
    const ssize_t length = ::readlink(procPath.c_str(), link.data(), link.size());
    const std::string_view read(link.data(), length > 0 ? size_t(length) : 0);
    if (!read.empty() && read.size() < link.size() && read.front() == '/' && !read.ends_with(" (deleted)"))
        return std::string(read);
    char* resolved = ::realpath(text.c_str(), nullptr);
    if (!resolved)
        return OMError::fromErrno("realpath " + text, errno);
    std::string canonical(resolved);
    std::free(resolved);
    return canonical;
}

Result<std::string> Sandbox::issueFileExtension(std::string_view extensionClass, std::string_view path, uint32_t flags)
{
    if (extensionClass != kReadOnlyFileClass)
        return posixError(EINVAL, "unknown sandbox extension class " + std::string(extensionClass));
    if ((flags & ~kCanonicalPath) != 0)
        return posixError(EINVAL, "unknown sandbox extension flags");
    std::string granted;
    if (flags & kCanonicalPath)
        granted = OM_TRY(canonicalPath(path));
    else
        granted = std::string(path);
    if (!granted.starts_with('/') || granted.find('\0') != std::string::npos)
        return posixError(EINVAL, "sandbox extensions grant absolute paths only");

    const Key key = OM_TRY(loadKey());
    const std::string time = std::to_string(static_cast<int64_t>(::time(nullptr)));
    const std::string mac = hexOf(macOf(key, extensionClass, time, granted));
    std::string token;
    token.reserve(extensionClass.size() + time.size() + mac.size() + granted.size() + 3);
    token.append(extensionClass).append(";").append(time).append(";").append(mac).append(";").append(granted);
    return token;
}

Result<std::string> Sandbox::verify(std::string_view token)
{
    auto fields = fieldsOf(token);
    auto claimed = fields ? macOfHex(fields->mac) : std::nullopt;
    if (!claimed)
        return posixError(EINVAL, "malformed sandbox token");
    const Key key = OM_TRY(loadKey());
    const auto expected = macOf(key, fields->extensionClass, fields->time, fields->path);
    if (!Digest::equalInConstantTime(expected, *claimed))
        return posixError(EPERM, "sandbox token not issued under this machine's key");
    return std::string(fields->path);
}

int64_t Sandbox::consume(std::string_view token)
{
    auto path = verify(token);
    if (!path.ok())
        return -1;
    // No symbolic link anywhere on the way: a component swapped for a link after issuing must not
    // lead the token to another file. O_NONBLOCK keeps a FIFO from hanging the open; it is cleared
    // again so that the handle reads like any other descriptor.
    open_how how {};
    how.flags = O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
    how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
    UniqueFd file(static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path->c_str(), &how, sizeof how)));
    if (!file.valid())
        return -1;
    const int status = ::fcntl(file.get(), F_GETFL);
    if (status < 0 || ::fcntl(file.get(), F_SETFL, status & ~O_NONBLOCK) < 0)
        return -1;
    // Never 0, 1 or 2: a handle must not be mistaken for a standard stream, nor close one on release.
    if (file.get() < 3) {
        UniqueFd moved(::fcntl(file.get(), F_DUPFD_CLOEXEC, 3));
        if (!moved.valid())
            return -1;
        file = std::move(moved);
    }
    return file.release();
}

void Sandbox::release(int64_t handle)
{
    if (handle < 3 || handle > INT_MAX)
        return;
    ::close(static_cast<int>(handle));
}

} // namespace om
