#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/Bundle.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"

using om::Bundle;
using om::Value;
using om::test::BundleFixture;

namespace {

Value withExecutable(const Value& executable)
{
    return Value::dictionary({ { "VBBundleIdentifier", "com.example.notes" }, { "VBBundleExecutable", executable } });
}

} // namespace

TEST(Bundle, DirectoryWithInfoIsABundleAtItsCanonicalPath)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    std::filesystem::create_directory_symlink(app, fixture.root() + "/Alias.app");

    for (const std::string& spelling : { app, app + "/", app + "/./", fixture.root() + "/Alias.app" }) {
        auto bundle = Bundle::withPath(spelling);
        EXPECT_EQ(bundle->bundlePath(), app) << spelling;
        EXPECT_EQ(bundle->supportFilesPath(), app) << spelling;
        EXPECT_EQ(bundle->executablePath(), app + "/Notes") << spelling;
    }
}

TEST(Bundle, DirectoryWithoutInfoAnswersNothing)
{
    BundleFixture fixture;
    std::string plain = fixture.makeDirectory("Plain.app");
    fixture.makeDirectory("Odd.app/Info.vlist"); // a directory is not an Info.vlist

    for (const std::string& path : { plain, fixture.root() + "/Odd.app", fixture.root() + "/Missing.app", std::string(),
             fixture.writeFile("file", "x") }) {
        auto bundle = Bundle::withPath(path);
        EXPECT_FALSE(bundle->bundlePath()) << path;
        EXPECT_FALSE(bundle->supportFilesPath()) << path;
        EXPECT_FALSE(bundle->executablePath()) << path;
        EXPECT_TRUE(bundle->infoDictionary().isNone()) << path;
    }
    EXPECT_EQ(Bundle::withPath(plain)->description(), "<Bundle " + plain + " (no bundle)>");
}

TEST(Bundle, ExecutableMustStayInsideTheBundle)
{
    BundleFixture fixture;
    std::string nested = fixture.makeBundle("Nested.app", withExecutable("bin/../bin/nested"));
    std::string dotted = fixture.makeBundle("Dotted.app", withExecutable("./Dotted"));
    EXPECT_EQ(Bundle::withPath(nested)->executablePath(), nested + "/bin/nested");
    EXPECT_EQ(Bundle::withPath(dotted)->executablePath(), dotted + "/Dotted");

    int index = 0;
    for (const Value& name : { Value("../Other.app/Other"), Value("/bin/sh"), Value("a/../../escape"), Value("."),
             Value(""), Value(42), Value::array({ "Notes" }) }) {
        std::string bundle = fixture.makeBundle("B" + std::to_string(index++) + ".app", withExecutable(name));
        EXPECT_FALSE(Bundle::withPath(bundle)->executablePath()) << name.description();
    }
}

TEST(Bundle, UnreadableInfoIsNoneButTheDirectoryStaysABundle)
{
    BundleFixture fixture;
    std::string broken = fixture.makeDirectory("Broken.app");
    fixture.writeFile("Broken.app/Info.vlist", "<vlist version=\"1\"><dict><key>a</key></dict></vlist>");
    std::string array = fixture.makeDirectory("Array.app");
    fixture.writeFile("Array.app/Info.vlist", om::Vlist::writeXml(Value::array({ "Notes" })));

    for (const std::string& path : { broken, array }) {
        auto bundle = Bundle::withPath(path);
        EXPECT_EQ(bundle->bundlePath(), path);
        EXPECT_TRUE(bundle->infoDictionary().isNone()) << path;
        EXPECT_FALSE(bundle->executablePath()) << path;
    }
}

TEST(Bundle, InfoReplacedOnDiskIsReadAgain)
{
    BundleFixture fixture;
    std::string app = fixture.makeBundle("Notes.app", withExecutable("Notes"));
    auto bundle = Bundle::withPath(app);
    ASSERT_EQ(*bundle->infoDictionary().stringFor("VBBundleExecutable"), "Notes");

    // Same size and, after the rename, the same modification time: only the file's identity
    // tells the versions apart.
    struct stat before;
    ASSERT_EQ(::stat((app + "/Info.vlist").c_str(), &before), 0);
    std::string replacement = fixture.writeFile("next.vlist", om::Vlist::writeXml(withExecutable("Memos")));
    timespec times[2] = { before.st_atim, before.st_mtim };
    ASSERT_EQ(::utimensat(AT_FDCWD, replacement.c_str(), times, 0), 0);
    std::filesystem::rename(replacement, app + "/Info.vlist");

    EXPECT_EQ(*bundle->infoDictionary().stringFor("VBBundleExecutable"), "Memos");
    EXPECT_EQ(bundle->executablePath(), app + "/Memos");

    std::filesystem::remove(app + "/Info.vlist");
    EXPECT_TRUE(bundle->infoDictionary().isNone());
    EXPECT_FALSE(bundle->executablePath());
}

TEST(Bundle, ContainingExecutableWalksPastBundlesNamingOtherFiles)
{
    BundleFixture fixture;
    std::string app = fixture.makeBundle("Tool.app", withExecutable("Contents/bin/tool"));
    fixture.makeBundle("Tool.app/Contents", withExecutable("helper"));

    auto bundle = Bundle::containingExecutable(app + "/Contents/bin/tool");
    EXPECT_EQ(bundle->bundlePath(), app);
    EXPECT_EQ(Bundle::containingExecutable(app + "/Contents/helper")->bundlePath(), app + "/Contents");
}

TEST(Bundle, ExecutableNamedByNoBundleHasNone)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    std::string helper = fixture.writeFile("Notes.app/Helpers/sync", "#!/bin/sh\n", 0755);
    std::string loose = fixture.writeFile("bin/tool", "#!/bin/sh\n", 0755);

    for (const std::string& path : { helper, loose, app, std::string(), fixture.root() + "/nowhere/x" }) {
        auto bundle = Bundle::containingExecutable(path);
        EXPECT_FALSE(bundle->bundlePath()) << path;
        EXPECT_TRUE(bundle->infoDictionary().isNone()) << path;
    }
}

TEST(Bundle, ContainingExecutableSeesThroughSymbolicLinks)
{
    BundleFixture fixture;
    std::string app = fixture.makeBundle("real/Notes.app", BundleFixture::appInfo("com.example.notes", "Notes"));
    std::filesystem::create_directory_symlink(fixture.root() + "/real", fixture.root() + "/link");

    EXPECT_EQ(Bundle::containingExecutable(fixture.root() + "/link/Notes.app/Notes")->bundlePath(), app);
    EXPECT_EQ(Bundle::containingExecutable(fixture.root() + "/link/../real/Notes.app/Notes")->bundlePath(), app);
}
