#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "platform/TypeConformance.h"
#include "tests/support/BundleFixture.h"

using om::TypeConformance;

namespace {

struct Case {
    std::string type;
    std::string to;
    bool conforms;
};

void expectCases(const TypeConformance& database, const std::vector<Case>& cases)
{
    for (const auto& test : cases)
        EXPECT_EQ(database.conforms(test.type, test.to), test.conforms) << test.type << " -> " << test.to;
}

// A private database in two data directories, <root>/high taking precedence over <root>/low.
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
        writeMime("high", "aliases", "old/name new/name\nshadowed/alias high/target\n");
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

} // namespace

TEST_F(TypeDatabase, ConformanceFollowsSubclassesAliasesAndTheImplicitRules)
{
    const std::string longest = "a/" + std::string(TypeConformance::kMaxTypeLength - 2, 'b');
    expectCases(database(),
        {
            // transitively, and only upwards
            { "image/x-child", "image/x-grandparent", true },
            { "image/x-grandparent", "image/x-child", false },
            { "image/x-multi", "audio/x-other", true },
            { "image/x-child", "audio/x-other", false },
            { "image/x-unknown", "image/x-unknown", true },
            // a cycle ends, and its members conform to each other
            { "cycle/one", "cycle/three", true },
            { "cycle/two", "cycle/one", true },
            { "cycle/one", "cycle/four", false },
            // case does not matter, in the query or the files
            { "IMAGE/X-CHILD", "Image/X-GrandParent", true },
            { "upper/case", "upper/parent", true },
            // an alias is its canonical type on either side, whichever directory declares what
            { "old/name", "new/name", true },
            { "new/name", "old/name", true },
            { "old/name", "base/type", true },
            { "application/x-kid", "base/type", true },
            { "base/type", "old/name", false },
            { "shadowed/alias", "high/target", true },
            { "shadowed/alias", "low/target", false },
            // text/* to text/plain, also through a parent; everything to application/octet-stream
            { "TEXT/HTML", "text/plain", true },
            { "application/x-script", "text/plain", true },
            { "image/x-child", "text/plain", false },
            { "text/plain", "text/x-anything", false },
            { "x-never/declared", "application/octet-stream", true },
            { "application/octet-stream", "image/x-child", false },
            // strings that are no type conform to nothing
            { longest, "application/octet-stream", true },
            { longest + "b", "application/octet-stream", false },
            { longest + "b", longest + "b", false },
            { "", "application/octet-stream", false },
            { "noslash", "noslash", false },
            { "a/b/c", "application/octet-stream", false },
            { "a/", "application/octet-stream", false },
            { "text/with space", "text/plain", false },
            { "text/caf\xc3\xa9", "text/plain", false },
            { "text/plain", "text/", false },
        });
    EXPECT_EQ(database().canonical("OLD/Name"), "new/name");
}

TEST_F(TypeDatabase, JunkLinesAreSkippedOneByOne)
{
    std::string junk = "# comment\n\njust-one-word\nthree/words here/too and/more\n"
                       "crlf/child crlf/parent\r\ndouble/space  double/parent\n";
    const char binary[] = "bin\0ary/x \xff\xfe/x\n";
    junk.append(binary, sizeof binary - 1);
    junk += "huge/" + std::string(100000, 'x') + " huge/parent\n";
    junk += "good/child good/parent\nlast/child last/parent"; // no final newline
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

TEST_F(TypeDatabase, OversizedFilesAndFifosContributeNothing)
{
    for (const off_t size : { off_t(TypeConformance::kMaxFileSize), off_t(TypeConformance::kMaxFileSize + 1) }) {
        writeMime("high", "subclasses", "big/child big/parent\n");
        ASSERT_EQ(::truncate((m_fixture.root() + "/high/mime/subclasses").c_str(), size), 0); // sparse
        EXPECT_EQ(database().conforms("big/child", "big/parent"), size <= off_t(TypeConformance::kMaxFileSize));
    }
    ASSERT_EQ(::unlink((m_fixture.root() + "/high/mime/subclasses").c_str()), 0);
    ASSERT_EQ(::mkfifo((m_fixture.root() + "/high/mime/subclasses").c_str(), 0600), 0); // no writer: would block
    EXPECT_FALSE(database().conforms("image/x-child", "image/x-parent"));
    EXPECT_TRUE(database().conforms("old/name", "base/type"));
}

// Facts of the installed shared-mime-info database, as this machine's files state them.
TEST(InstalledTypeDatabase, FollowsTheSystemFiles)
{
    struct stat info;
    if (::stat("/usr/share/mime/subclasses", &info) != 0)
        GTEST_SKIP() << "no shared-mime-info database";
    expectCases(TypeConformance::fromDirectories({ "/usr/share" }),
        {
            { "application/x-shellscript", "text/plain", true },
            { "application/x-shellscript", "application/x-executable", true },
            { "application/x-csh", "text/plain", true }, // through application/x-shellscript
            { "image/svg+xml", "text/plain", true }, // through application/xml
            { "text/xml", "application/xml", true }, // an alias
            { "image/png", "text/plain", false },
            { "text/plain", "application/x-shellscript", false },
        });
    EXPECT_TRUE(TypeConformance::shared().conforms("application/x-csh", "text/plain"));
}
