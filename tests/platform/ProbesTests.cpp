#include <elf.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <link.h>
#include <unistd.h>

#include <cstring>
#include <map>
#include <vector>

#include "platform/Probes.h"

namespace {

struct ProbeNote {
    std::string provider;
    std::string name;
    std::string arguments;
    uint64_t semaphore = 0;
};

// Sizes (negative: signed) of each probe's arguments, as tracers read them from the notes.
const std::map<std::string, std::vector<int>> kExpectedProbes = {
    { "client__new", { -4 } },
    { "client__done", { -4 } },
    { "request__input", { -4, 8 } },
    { "request", { -4, 8 } },
    { "request__output", { -4, 8 } },
    { "discover__raw", { 4 } },
    { "plugin__add", { 8 } },
    { "plugin__remove", { 8, 1 } },
    { "plugin__ready", { 8 } },
    { "db__load", { 8, 8 } },
};

// Every probe fires here once, so this binary carries a note for each.
void fireEveryProbe()
{
    int pid = ::getpid();
    const char* text = "text";
    unsigned int count = 3;
    bool flag = true;
    uint64_t size = 4096;
    OM_PROBE1(client__new, pid);
    OM_PROBE1(client__done, pid);
    OM_PROBE2(request__input, pid, text);
    OM_PROBE2(request, pid, text);
    OM_PROBE2(request__output, pid, text);
    OM_PROBE1(discover__raw, count);
    OM_PROBE1(plugin__add, text);
    OM_PROBE2(plugin__remove, text, flag);
    OM_PROBE1(plugin__ready, text);
    OM_PROBE2(db__load, text, size);
}

std::vector<uint8_t> readSection(int fd, const char* wanted)
{
    Elf64_Ehdr header;
    if (::pread(fd, &header, sizeof header, 0) != sizeof header || std::memcmp(header.e_ident, ELFMAG, SELFMAG) != 0)
        return {};
    std::vector<Elf64_Shdr> sections(header.e_shnum);
    auto bytes = static_cast<ssize_t>(sections.size() * sizeof(Elf64_Shdr));
    if (::pread(fd, sections.data(), static_cast<size_t>(bytes), static_cast<off_t>(header.e_shoff)) != bytes)
        return {};
    const Elf64_Shdr& names = sections.at(header.e_shstrndx);
    std::vector<char> nameTable(names.sh_size);
    (void)::pread(fd, nameTable.data(), nameTable.size(), static_cast<off_t>(names.sh_offset));
    for (const auto& section : sections) {
        if (section.sh_name >= nameTable.size() || std::strcmp(&nameTable[section.sh_name], wanted) != 0)
            continue;
        std::vector<uint8_t> content(section.sh_size);
        (void)::pread(fd, content.data(), content.size(), static_cast<off_t>(section.sh_offset));
        return content;
    }
    return {};
}

std::vector<ProbeNote> probeNotesOfThisBinary()
{
    int fd = ::open("/proc/self/exe", O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return {};
    auto content = readSection(fd, ".note.stapsdt");
    ::close(fd);

    std::vector<ProbeNote> notes;
    size_t offset = 0;
    auto align4 = [](size_t n) { return (n + 3) & ~size_t(3); };
    while (offset + sizeof(Elf64_Nhdr) <= content.size()) {
        Elf64_Nhdr note;
        std::memcpy(&note, &content[offset], sizeof note);
        size_t name = offset + sizeof note;
        size_t desc = name + align4(note.n_namesz);
        offset = desc + align4(note.n_descsz);
        if (offset > content.size() || note.n_type != 3 || note.n_descsz < 3 * 8)
            continue;
        // pc, base, semaphore, then three NUL-terminated strings: provider, name, arguments.
        ProbeNote probe;
        std::memcpy(&probe.semaphore, &content[desc + 16], 8);
        const char* strings = reinterpret_cast<const char*>(&content[desc + 24]);
        probe.provider = strings;
        probe.name = strings + probe.provider.size() + 1;
        probe.arguments = strings + probe.provider.size() + probe.name.size() + 2;
        notes.push_back(std::move(probe));
    }
    return notes;
}

std::vector<int> argumentSizes(const std::string& arguments)
{
    std::vector<int> sizes;
    size_t start = 0;
    while (start < arguments.size()) {
        size_t end = arguments.find(' ', start);
        if (end == std::string::npos)
            end = arguments.size();
        sizes.push_back(std::stoi(arguments.substr(start, arguments.find('@', start) - start)));
        start = end + 1;
    }
    return sizes;
}

uintptr_t loadBias()
{
    uintptr_t bias = 0;
    // The first object reported is the executable itself.
    ::dl_iterate_phdr(
        [](struct dl_phdr_info* info, size_t, void* out) {
            *static_cast<uintptr_t*>(out) = info->dlpi_addr;
            return 1;
        },
        &bias);
    return bias;
}

const std::map<std::string, const unsigned short*> kSemaphores = {
    { "client__new", &omd_client__new_semaphore },
    { "client__done", &omd_client__done_semaphore },
    { "request__input", &omd_request__input_semaphore },
    { "request", &omd_request_semaphore },
    { "request__output", &omd_request__output_semaphore },
    { "discover__raw", &omd_discover__raw_semaphore },
    { "plugin__add", &omd_plugin__add_semaphore },
    { "plugin__remove", &omd_plugin__remove_semaphore },
    { "plugin__ready", &omd_plugin__ready_semaphore },
    { "db__load", &omd_db__load_semaphore },
};

} // namespace

TEST(Probes, EveryProbeIsInTheBinaryWithItsArgumentTypes)
{
    fireEveryProbe(); // with no tracer attached, each probe is a nop
    std::map<std::string, int> seen;
    for (const auto& note : probeNotesOfThisBinary()) {
        if (note.provider != "omd")
            continue;
        auto expected = kExpectedProbes.find(note.name);
        ASSERT_NE(expected, kExpectedProbes.end()) << "unknown probe " << note.name;
        EXPECT_EQ(argumentSizes(note.arguments), expected->second)
            << note.name << " fired with arguments " << note.arguments;
        ++seen[note.name];
    }
    for (const auto& [name, sizes] : kExpectedProbes)
        EXPECT_GE(seen[name], 1) << "no note for probe " << name;
}

TEST(Probes, NotesPointAtTheProbesSemaphores)
{
    uintptr_t bias = loadBias();
    int checked = 0;
    for (const auto& note : probeNotesOfThisBinary()) {
        if (note.provider != "omd")
            continue;
        ASSERT_NE(note.semaphore, 0u) << note.name << " has no semaphore";
        EXPECT_EQ(reinterpret_cast<const unsigned short*>(note.semaphore + bias), kSemaphores.at(note.name))
            << note.name;
        ++checked;
    }
    EXPECT_GE(checked, 10);
}

TEST(Probes, DisabledWithoutATracerSoDescriptionsAreNotBuilt)
{
    for (const auto& [name, semaphore] : kSemaphores)
        EXPECT_EQ(*semaphore, 0) << name;

    int described = 0;
    if (OM_PROBE_ENABLED(request__input)) {
        ++described;
        OM_PROBE2(request__input, 1, "described");
    }
    if (OM_PROBE_ENABLED(db__load)) {
        ++described;
        OM_PROBE2(db__load, "path", uint64_t(1));
    }
    EXPECT_EQ(described, 0);
}
