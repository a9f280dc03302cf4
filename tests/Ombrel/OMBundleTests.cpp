#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <thread>
#include <vector>

#include "Ombrel/OMBundle.h"
#include "platform/Log.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"

using om::Bundle;
using om::Log;
using om::LogLevel;
using om::OMBundle;
using om::Value;
using om::test::BundleFixture;

namespace {

// The one record with this message, checked to be an info record of the daemon's "ops" log.
void expectOpsInfo(const Log::Capture& capture, const std::string& message)
{
    size_t matches = 0;
    for (const auto& record : capture.records()) {
        if (record.message != message)
            continue;
        ++matches;
        EXPECT_EQ(record.subsystem, "com.orvex.Ombrel");
        EXPECT_EQ(record.category, "ops");
        EXPECT_EQ(record.level, LogLevel::Info);
    }
    EXPECT_EQ(matches, 1u) << message;
}

} // namespace

TEST(OMBundle, ExecutableGivesTheNearestBundleNamingIt)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    std::string share = fixture.makePlugIn(app, "Share", "com.example.notes.share", "com.orvex.share-services");

    auto bundle = OMBundle::initWithExecutablePath(app + "/Notes");
    EXPECT_EQ(bundle->path(), app);
    EXPECT_EQ(bundle->executablePath(), app + "/Notes");
    EXPECT_EQ(bundle->bundleIdentifier(), "com.example.notes");
    // The plug-in inside the app, not the app.
    EXPECT_EQ(OMBundle::initWithExecutablePath(share + "/Share")->path(), share);
}

TEST(OMBundle, PathInNoBundleIsReadAsABundleDirectory)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");

    // The app directory is nobody's executable, so it is read as the bundle itself.
    auto bundle = OMBundle::initWithExecutablePath(app);
    EXPECT_EQ(bundle->path(), app);
    EXPECT_EQ(bundle->executablePath(), app + "/Notes");

    auto loose = OMBundle::initWithExecutablePath(fixture.writeFile("bin/tool", "#!/bin/sh\n", 0755));
    EXPECT_FALSE(loose->path());
    EXPECT_FALSE(loose->executablePath());
    EXPECT_FALSE(loose->url());
    EXPECT_FALSE(loose->plugInsPath());
    EXPECT_FALSE(loose->bundleIdentifier());
}

TEST(OMBundle, ExecutablePathOfABundleWithoutOneIsItsPath)
{
    BundleFixture fixture;
    std::string data = fixture.makeBundle("Data.appex", BundleFixture::appInfo("com.example.data", ""));

    auto bundle = OMBundle::initWithPath(data);
    EXPECT_FALSE(bundle->stringProperty(OMBundle::Property::ExecutablePath));
    EXPECT_EQ(bundle->executablePath(), data);
}

TEST(OMBundle, PlugInsLiveUnderTheSupportFilesNotTheBundlePath)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    std::string support = fixture.makeDirectory("Library/Notes");

    auto apart = OMBundle::initWithConduitBundle(Bundle::withDirectories(app, support));
    EXPECT_EQ(apart->path(), app);
    EXPECT_EQ(apart->supportPath(), support);
    EXPECT_EQ(apart->plugInsPath(), support + "/PlugIns");
    EXPECT_EQ(apart->bundleDirectory("Resources"), support + "/Resources");

    EXPECT_EQ(OMBundle::initWithPath(app)->plugInsPath(), app + "/PlugIns");
}

TEST(OMBundle, SupportPathAbsentKeepsNothing)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    auto bundle = OMBundle::initWithConduitBundle(Bundle::withDirectories(app, fixture.root() + "/missing"));

    EXPECT_EQ(bundle->path(), app);
    EXPECT_FALSE(bundle->supportPath());
    EXPECT_FALSE(bundle->plugInsPath());
    EXPECT_FALSE(bundle->bundleDirectory("Resources"));
}

TEST(OMBundle, FirstSupportPathReadsRaceToTheSameAnswer)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    auto bundle = OMBundle::initWithPath(app);

    std::vector<std::optional<std::string>> seen(4);
    std::vector<std::thread> threads;
    for (auto& slot : seen)
        threads.emplace_back([&bundle, &slot] { slot = bundle->plugInsPath(); });
    for (auto& thread : threads)
        thread.join();
    for (const auto& answer : seen)
        EXPECT_EQ(answer, app + "/PlugIns");
}

TEST(OMBundle, BundleIdentifierNeedsAStringUnderItsKey)
{
    BundleFixture fixture;
    std::string unnamed = fixture.makeBundle("Unnamed.app", Value::dictionary({ { "VBBundleExecutable", "x" } }));
    std::string numbered = fixture.makeBundle("Numbered.app", Value::dictionary({ { "VBBundleIdentifier", 7 } }));
    std::string bare = fixture.makeDirectory("Bare.app");

    EXPECT_FALSE(OMBundle::initWithPath(unnamed)->bundleIdentifier());
    EXPECT_FALSE(OMBundle::initWithPath(numbered)->bundleIdentifier());
    EXPECT_FALSE(OMBundle::initWithPath(bare)->bundleIdentifier());
}

TEST(OMBundle, InfoDictionaryIsTheFileInEitherForm)
{
    BundleFixture fixture;
    Value info = BundleFixture::plugInInfo("com.example.notes.share", "Share", "com.orvex.share-services",
        Value::dictionary({ { "QSExtensionVersion", "2.1" } }));
    std::string xml = fixture.makeBundle("Xml.appex", info, BundleFixture::Form::Xml);
    std::string binary = fixture.makeBundle("Binary.appex", info, BundleFixture::Form::Binary);

    EXPECT_EQ(OMBundle::initWithPath(xml)->infoDictionary(), info);
    EXPECT_EQ(OMBundle::initWithPath(binary)->infoDictionary(), info);
    EXPECT_EQ(OMBundle::initWithPath(binary)->bundleIdentifier(), "com.example.notes.share");
}

TEST(OMBundle, MissingInfoLogsFailedToRetrieve)
{
    BundleFixture fixture;
    std::string bare = fixture.makeDirectory("Bare.app");
    Log::Capture capture;

    EXPECT_TRUE(OMBundle::initWithPath(bare)->infoDictionary().isNone());
    expectOpsInfo(capture, "failed to retrieve Info.vlist for (null) through <Bundle " + bare + " (no bundle)>");
}

TEST(OMBundle, UnparsableInfoLogsFailedToRetrieveWithThePath)
{
    BundleFixture fixture;
    std::string broken = fixture.makeDirectory("Broken.app");
    fixture.writeFile("Broken.app/Info.vlist", "<vlist version=\"1\"><dict><key>a</key><bogus/></dict></vlist>");
    Log::Capture capture;

    auto bundle = OMBundle::initWithPath(broken);
    EXPECT_TRUE(bundle->infoDictionary().isNone());
    EXPECT_EQ(bundle->path(), broken);
    expectOpsInfo(capture, "failed to retrieve Info.vlist for " + broken + " through <Bundle " + broken + ">");
}

TEST(OMBundle, InfoIsReadAgainAtEveryCall)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("Notes", "com.example.notes");
    auto bundle = OMBundle::initWithPath(app);
    ASSERT_EQ(bundle->bundleIdentifier(), "com.example.notes");

    fixture.writeFile(
        "Notes.app/Info.vlist", om::Vlist::writeXml(BundleFixture::appInfo("com.example.notes.renamed", "Notes")));
    EXPECT_EQ(bundle->bundleIdentifier(), "com.example.notes.renamed");
    EXPECT_EQ(*bundle->infoDictionary().stringFor("VBBundleIdentifier"), "com.example.notes.renamed");
}

TEST(OMBundle, URLsAreFileURLsOfThePath)
{
    BundleFixture fixture;
    std::string app = fixture.makeApp("My Notes%", "com.example.notes");

    auto bundle = OMBundle::initWithURL(OMBundle::fileURL(app));
    EXPECT_EQ(bundle->path(), app);
    EXPECT_EQ(bundle->url(), "file://" + fixture.root() + "/My%20Notes%25.app");
    EXPECT_EQ(OMBundle::initWithExecutableURL(OMBundle::fileURL(app + "/My Notes%"))->path(), app);
    EXPECT_EQ(OMBundle::initWithURL("file://localhost" + fixture.root() + "/My%20Notes%25.app")->path(), app);
}

TEST(OMBundle, FileURLRoundTripsEveryByte)
{
    std::string path = "/";
    for (int c = 1; c < 256; ++c)
        path += static_cast<char>(c);
    std::string url = OMBundle::fileURL(path);
    for (size_t i = 0; i < url.size(); ++i) {
        auto c = static_cast<unsigned char>(url[i]);
        EXPECT_TRUE(c > 0x20 && c < 0x7f && !std::strchr("?#[]\"<>\\^`{|}", c)) << "byte " << i;
    }
    EXPECT_EQ(OMBundle::pathOfFileURL(url), path);
}

TEST(OMBundle, OnlyWellFormedFileURLsHaveAPath)
{
    EXPECT_EQ(OMBundle::pathOfFileURL("FILE:///a/b"), "/a/b");
    EXPECT_EQ(OMBundle::pathOfFileURL("file:///a/b?query#fragment"), "/a/b");
    EXPECT_EQ(OMBundle::pathOfFileURL("file:///a%2fb"), "/a/b");
    for (const char* url : { "", "http://host/a", "file:/a", "file://a", "file://otherhost/a", "file://", "file:///a%",
             "file:///a%4", "file:///a%4g", "file:///a%00b", "/a/b" })
        EXPECT_FALSE(OMBundle::pathOfFileURL(url)) << url;

    auto bundle = OMBundle::initWithURL("http://example.com/Notes.app");
    EXPECT_FALSE(bundle->path());
    EXPECT_TRUE(bundle->infoDictionary().isNone());
}

TEST(OMBundle, NullHandleAnswersNothing)
{
    auto bundle = OMBundle::initWithConduitBundle(nullptr);
    ASSERT_TRUE(bundle->conduitBundle());
    EXPECT_FALSE(bundle->path());
    EXPECT_FALSE(bundle->executablePath());
    EXPECT_FALSE(bundle->supportPath());
    EXPECT_FALSE(bundle->bundleIdentifier());
}

TEST(OMBundle, SampleAppsAndTheirPlugInsRead)
{
    const std::string samples = std::filesystem::canonical(std::string(OM_BINARY_DIR) + "/samples").string();
    struct Sample {
        std::string app, appIdentifier, plugIn, plugInIdentifier, extensionPoint;
    };
    for (const Sample& sample :
        { Sample { "Notes", "com.example.notes", "Share", "com.example.notes.share", "com.orvex.share-services" },
            Sample { "Photos", "com.example.photos", "Preview", "com.example.photos.preview",
                "com.orvex.glance.extension.preview" } }) {
        std::string app = samples + "/" + sample.app + ".app";
        auto bundle = OMBundle::initWithExecutablePath(app + "/" + sample.app);
        EXPECT_EQ(bundle->path(), app);
        EXPECT_EQ(bundle->bundleIdentifier(), sample.appIdentifier);
        EXPECT_EQ(::access(bundle->executablePath()->c_str(), X_OK), 0) << *bundle->executablePath();

        std::string plugInPath = *bundle->plugInsPath() + "/" + sample.plugIn + ".appex";
        auto plugIn = OMBundle::initWithExecutablePath(plugInPath + "/" + sample.plugIn);
        EXPECT_EQ(plugIn->path(), plugInPath);
        EXPECT_EQ(plugIn->bundleIdentifier(), sample.plugInIdentifier);
        EXPECT_EQ(
            *plugIn->infoDictionary()["QSExtension"].stringFor("QSExtensionPointIdentifier"), sample.extensionPoint);
    }
}
