#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/TypeConformance.h"
#include "tests/support/BundleFixture.h"

using om::TypeConformance;

namespace {

// A private database: <root>/high and <root>/low, in that order of precedence.
class TypeDatabase : public ::testing::Test {
protected:
    void SetUp() override
    {
        writeMime("high", "subclasses",
            "image/x-child image/x-parent\n"
            "image/x-parent image/x-grandparent\n"
            "image/x-multi image/x-parent\n"
            "image/x-multi audio/x-other\n"
            "cycle/one cycle/two\n"
            "cycle/two cycle/three\n"
            "cycle/three cycle/one\n"
            "Upper/Case Upper/PARENT\n"
            "application/x-script text/x-source\n"
            "application/x-kid old/name\n");
        writeMime("high", "aliases",
            "old/name new/name\n"
            "shadowed/alias high/target\n");
        writeMime("low", "subclasses", "new/name base/type\n");
        writeMime("low", "aliases", "shadowed/alias low/target\n");
    }

    void writeMime(const std::string& directory, const std::string& file, std::string_view text)
    {
        m_fixture.writeFile(directory + "/mime/" + file, text);
    }

    TypeConformance database() const
    {
        return TypeConformance::fromDirectories({ m_fixture.root() + "/high", m_fixture.root() + "/low" });
    }

    om::test::BundleFixture m_fixture;
};

struct Case {
    const char* type;
    const char* to;
    bool conforms;
};

void expectCases(const TypeConformance& database, std::initializer_list<Case> cases)
{
    for (const auto& test : cases)
        EXPECT_EQ(database.conforms(test.type, test.to), test.conforms) << test.type << " -> " << test.to;
}

} // namespace

TEST_F(TypeDatabase, SubclassesConformTransitivelyAndOnlyUpwards)
{
    expectCases(database(),
        {
            { "image/x-child", "image/x-parent", true },
            { "image/x-child", "image/x-grandparent", true },
            { "image/x-grandparent", "image/x-child", false },
            { "image/x-parent", "image/x-child", false },
            { "image/x-multi", "audio/x-other", true },
            { "image/x-multi", "image/x-grandparent", true },
            { "image/x-child", "audio/x-other", false },
            { "image/x-unknown", "image/x-unknown", true },
            { "image/x-unknown", "image/x-parent", false },
        });
}

TEST_F(TypeDatabase, CyclesEndAndStillConform)
{
    expectCases(database(),
        {
            { "cycle/one", "cycle/three", true },
            { "cycle/three", "cycle/two", true },
            { "cycle/two", "cycle/one", true },
            { "cycle/one", "cycle/four", false },
        });
}

TEST_F(TypeDatabase, TypesCompareWithoutRegardToCase)
{
    expectCases(database(),
        {
            { "IMAGE/X-CHILD", "image/x-grandparent", true },
            { "image/x-child", "Image/X-GrandParent", true },
            { "upper/case", "upper/parent", true },
            { "TEXT/HTML", "text/plain", true },
            { "Text/Plain", "TEXT/PLAIN", true },
        });
    EXPECT_EQ(database().canonical("Upper/Case"), "upper/case");
}

TEST_F(TypeDatabase, AliasesStandForTheirCanonicalTypeOnEitherSide)
{
    expectCases(database(),
        {
            { "old/name", "new/name", true },
            { "new/name", "old/name", true },
            { "old/name", "base/type", true }, // the subclass is declared, in another directory, on the canonical name
            { "application/x-kid", "base/type", true }, // declared on the alias
            { "base/type", "old/name", false },
        });
    EXPECT_EQ(database().canonical("OLD/Name"), "new/name");
}

TEST_F(TypeDatabase, TheFirstDirectoryDecidesAnAlias)
{
    EXPECT_EQ(database().canonical("shadowed/alias"), "high/target");
    expectCases(database(), { { "shadowed/alias", "high/target", true }, { "shadowed/alias", "low/target", false } });
}

TEST_F(TypeDatabase, ImplicitRulesForTextAndOctetStream)
{
    expectCases(database(),
        {
            { "text/x-anything", "text/plain", true },
            { "application/x-script", "text/plain", true }, // through its text/* parent
            { "image/x-child", "text/plain", false },
            { "text/plain", "text/x-anything", false },
            { "image/x-child", "application/octet-stream", true },
            { "x-never/declared", "application/octet-stream", true },
            { "application/octet-stream", "image/x-child", false },
        });
}

TEST_F(TypeDatabase, StringsThatAreNoTypeConformToNothing)
{
    const std::string longest = "a/" + std::string(TypeConformance::kMaxTypeLength - 2, 'b');
    const std::string tooLong = longest + "b";
    expectCases(database(),
        {
            { longest.c_str(), "application/octet-stream", true },
            { longest.c_str(), longest.c_str(), true },
            { tooLong.c_str(), "application/octet-stream", false },
            { tooLong.c_str(), tooLong.c_str(), false },
            { "", "application/octet-stream", false },
            { "noslash", "noslash", false },
            { "a/b/c", "application/octet-stream", false },
            { "/b", "application/octet-stream", false },
            { "a/", "application/octet-stream", false },
            { "text/with space", "text/plain", false },
            { "text/tab\there", "text/plain", false },
            { "text/caf\xc3\xa9", "text/plain", false },
            { "text/plain", "", false },
            { "text/plain", "text/", false },
        });
}

TEST_F(TypeDatabase, JunkLinesAreSkippedOneByOne)
{
    std::string junk = "# comment line\n"
                       "\n"
                       "just-one-word\n"
                       "three/words here/too and/more\n"
                       "crlf/child crlf/parent\r\n"
                       "double/space  double/parent\n";
    const char binary[] = "bin\0ary/x \xff\xfe/x\n";
    junk.append(binary, sizeof binary - 1);
    junk += "huge/" + std::string(100000, 'x') + " huge/parent\n";
    junk += "good/child good/parent\n";
    junk += "last/child last/parent"; // no final newline
    writeMime("high", "subclasses", junk);

    expectCases(database(),
        {
            { "good/child", "good/parent", true },
            { "last/child", "last/parent", true },
            { "crlf/child", "crlf/parent", false },
            { "double/space", "double/parent", false },
            { "three/words", "here/too", false },
        });
}

TEST_F(TypeDatabase, AFileLargerThanTheLimitIsIgnoredWhole)
{
    for (const off_t size : { off_t(TypeConformance::kMaxFileSize), off_t(TypeConformance::kMaxFileSize + 1) }) {
        writeMime("high", "subclasses", "big/child big/parent\n");
        ASSERT_EQ(::truncate((m_fixture.root() + "/high/mime/subclasses").c_str(), size), 0); // sparse
        EXPECT_EQ(database().conforms("big/child", "big/parent"), size <= off_t(TypeConformance::kMaxFileSize)) << size;
    }
}

TEST_F(TypeDatabase, MissingFilesAndAFifoInTheirPlaceLeaveAnEmptyDatabase)
{
    m_fixture.makeDirectory("fifo/mime");
    ASSERT_EQ(::mkfifo((m_fixture.root() + "/fifo/mime/subclasses").c_str(), 0600), 0);
    const auto empty = TypeConformance::fromDirectories({ m_fixture.root() + "/fifo", m_fixture.root() + "/none" });
    EXPECT_FALSE(empty.conforms("image/x-child", "image/x-parent"));
    EXPECT_TRUE(empty.conforms("text/html", "text/plain"));
}

// Facts of the installed shared-mime-info database, as this machine's files state them.
TEST(InstalledTypeDatabase, FollowsTheSystemFiles)
{
    struct stat info;
    if (::stat("/usr/share/mime/subclasses", &info) != 0)
        GTEST_SKIP() << "no shared-mime-info database";
    const auto system = TypeConformance::fromDirectories({ "/usr/share" });
    expectCases(system,
        {
            { "application/x-shellscript", "text/plain", true },
            { "application/x-shellscript", "application/x-executable", true },
            { "application/x-csh", "text/plain", true }, // through application/x-shellscript
            { "application/xml", "text/plain", true },
            { "image/svg+xml", "text/plain", true }, // through application/xml
            { "text/xml", "application/xml", true }, // an alias
            { "image/png", "text/plain", false },
            { "text/plain", "application/x-shellscript", false },
        });
}

// The machine's database is built once, whichever thread asks first.
TEST(InstalledTypeDatabase, SharedIsOneDatabaseForEveryThread)
{
    std::vector<const TypeConformance*> seen(8);
    std::vector<std::thread> threads;
    for (size_t i = 0; i < seen.size(); ++i) {
        threads.emplace_back([&seen, i] {
            seen[i] = &TypeConformance::shared();
            EXPECT_TRUE(seen[i]->conforms("text/x-csrc", "text/plain"));
        });
    }
    for (auto& thread : threads)
        thread.join();
    for (const auto* database : seen)
        EXPECT_EQ(database, seen[0]);
}
