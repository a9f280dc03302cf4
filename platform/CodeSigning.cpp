#include "platform/CodeSigning.h"

#include <elf.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "platform/Vlist.h"

namespace om {

namespace {

constexpr std::string_view kSectionName = ".entitlements";
// Bounds on what a hostile file can make us read. Real executables have a few dozen sections and
// entitlements of a few hundred bytes.
constexpr uint64_t kMaxSectionTableBytes = 1 << 20;
constexpr uint64_t kMaxNameTableBytes = 1 << 20;
constexpr uint64_t kMaxEntitlementBytes = 1 << 20;

#if __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
constexpr unsigned char kNativeData = ELFDATA2LSB;
#else
constexpr unsigned char kNativeData = ELFDATA2MSB;
#endif

OMError malformed(std::string what)
{
    return OMError::platform(kPlatformErrorMalformed, "entitlements: " + std::move(what));
}

bool fits(uint64_t offset, uint64_t size, uint64_t fileSize)
{
    return offset <= fileSize && size <= fileSize - offset;
}

Result<void> readAt(int fd, void* buffer, size_t size, uint64_t offset)
{
    auto* bytes = static_cast<uint8_t*>(buffer);
    size_t done = 0;
    while (done < size) {
        ssize_t n = ::pread(fd, bytes + done, size - done, static_cast<off_t>(offset + done));
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return OMError::fromErrno("pread", errno);
        if (n == 0)
            return malformed("file shorter than its headers say");
        done += static_cast<size_t>(n);
    }
    return {};
}

// The ELF facts needed to find a section by name.
struct SectionTable {
    std::vector<Elf64_Shdr> sections;
    std::vector<char> names;
};

// None when the file is not an ELF file we read or has no section table; an error when the table
// it claims does not fit in the file.
Result<std::optional<SectionTable>> readSectionTable(int fd, uint64_t fileSize)
{
    Elf64_Ehdr header;
    if (fileSize < sizeof header)
        return std::optional<SectionTable>();
    OM_TRY(readAt(fd, &header, sizeof header, 0));
    if (std::memcmp(header.e_ident, ELFMAG, SELFMAG) != 0 || header.e_ident[EI_CLASS] != ELFCLASS64
        || header.e_ident[EI_DATA] != kNativeData || header.e_shoff == 0)
        return std::optional<SectionTable>();
    if (header.e_shentsize != sizeof(Elf64_Shdr))
        return malformed("unexpected section header size");

    // Past 0xff00 sections the count and the names index move into section 0.
    Elf64_Shdr first;
    if (!fits(header.e_shoff, sizeof first, fileSize))
        return malformed("section table outside the file");
    OM_TRY(readAt(fd, &first, sizeof first, header.e_shoff));
    uint64_t count = header.e_shnum != 0 ? header.e_shnum : first.sh_size;
    uint64_t namesIndex = header.e_shstrndx == SHN_XINDEX ? first.sh_link : header.e_shstrndx;
    if (count == 0 || namesIndex == SHN_UNDEF)
        return std::optional<SectionTable>();
    if (count > kMaxSectionTableBytes / sizeof(Elf64_Shdr))
        return OMError::platform(kPlatformErrorLimit, "entitlements: too many sections");
    if (!fits(header.e_shoff, count * sizeof(Elf64_Shdr), fileSize))
        return malformed("section table outside the file");
    if (namesIndex >= count)
        return malformed("section name table index out of range");

    SectionTable table;
    table.sections.resize(count);
    OM_TRY(readAt(fd, table.sections.data(), count * sizeof(Elf64_Shdr), header.e_shoff));
    const Elf64_Shdr& names = table.sections[namesIndex];
    if (names.sh_type != SHT_STRTAB)
        return malformed("section name table has the wrong type");
    if (names.sh_size > kMaxNameTableBytes)
        return OMError::platform(kPlatformErrorLimit, "entitlements: section name table too large");
    if (!fits(names.sh_offset, names.sh_size, fileSize))
        return malformed("section name table outside the file");
    table.names.resize(names.sh_size);
    OM_TRY(readAt(fd, table.names.data(), table.names.size(), names.sh_offset));
    return std::optional<SectionTable>(std::move(table));
}

bool hasName(const SectionTable& table, const Elf64_Shdr& section, std::string_view name)
{
    // The name must end with its NUL inside the table.
    if (section.sh_name >= table.names.size() || table.names.size() - section.sh_name <= name.size())
        return false;
    const char* text = table.names.data() + section.sh_name;
    return std::memcmp(text, name.data(), name.size()) == 0 && text[name.size()] == '\0';
}

Result<std::optional<std::vector<uint8_t>>> readSection(int fd, uint64_t fileSize, std::string_view name)
{
    auto table = OM_TRY(readSectionTable(fd, fileSize));
    if (!table)
        return std::optional<std::vector<uint8_t>>();

    const Elf64_Shdr* found = nullptr;
    for (const Elf64_Shdr& section : table->sections) {
        if (!hasName(*table, section, name))
            continue;
        // Two sections would leave it to the reader which one counts.
        if (found)
            return malformed("more than one section");
        found = &section;
    }
    if (!found)
        return std::optional<std::vector<uint8_t>>();
    if (found->sh_type == SHT_NOBITS)
        return malformed("section has no contents");
    if (found->sh_size > kMaxEntitlementBytes)
        return OMError::platform(kPlatformErrorLimit, "entitlements: section too large");
    if (!fits(found->sh_offset, found->sh_size, fileSize))
        return malformed("section outside the file");
    std::vector<uint8_t> bytes(found->sh_size);
    OM_TRY(readAt(fd, bytes.data(), bytes.size(), found->sh_offset));
    return std::optional<std::vector<uint8_t>>(std::move(bytes));
}

} // namespace

bool CodeSigningTask::ownerMayGrant(const struct stat& info)
{
    bool owner = info.st_uid == 0 || info.st_uid == ::geteuid();
    bool othersMayWrite = (info.st_mode & (S_IWGRP | S_IWOTH)) != 0;
    return S_ISREG(info.st_mode) && owner && !othersMayWrite;
}

CodeSigningTask::CodeSigningTask(bool trusted, Value entitlements, std::optional<OMError> error)
    : m_trusted(trusted)
    , m_entitlements(std::move(entitlements))
    , m_error(std::move(error))
{
}

Result<Value> CodeSigningTask::readEntitlements(int fd)
{
    struct stat info;
    if (::fstat(fd, &info) < 0)
        return OMError::fromErrno("fstat", errno);
    auto bytes = OM_TRY(readSection(fd, static_cast<uint64_t>(info.st_size), kSectionName));
    if (!bytes)
        return Value();
    auto parsed = Vlist::parse(std::span<const uint8_t>(*bytes));
    if (!parsed.ok())
        return malformed(parsed.error().localizedDescription());
    if (!parsed->isDictionary())
        return malformed("not a dictionary");
    return std::move(parsed).releaseValue();
}

std::shared_ptr<CodeSigningTask> CodeSigningTask::create(const AuditToken& token)
{
    auto executable = Process::openExecutable(token);
    if (!executable.ok())
        return nullptr;
    struct stat info;
    if (::fstat(executable->get(), &info) < 0)
        return nullptr;
    if (!ownerMayGrant(info))
        return std::shared_ptr<CodeSigningTask>(new CodeSigningTask(false, Value(), std::nullopt));

    auto entitlements = readEntitlements(executable->get());
    if (!entitlements.ok())
        return std::shared_ptr<CodeSigningTask>(new CodeSigningTask(true, Value(), entitlements.error()));
    return std::shared_ptr<CodeSigningTask>(
        new CodeSigningTask(true, std::move(entitlements).releaseValue(), std::nullopt));
}

Result<Value> CodeSigningTask::entitlementValue(std::string_view key) const
{
    if (m_error)
        return *m_error;
    return m_entitlements[key];
}

} // namespace om
