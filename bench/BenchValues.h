// Shared benchmark fixtures: realistic value trees of the shapes the daemon encodes and decodes
// most (a plug-in's info dictionary, the annotation table, a typical request).
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/Uuid.h"
#include "platform/Value.h"

namespace om::bench {

// A fixed UUID so that encodings are identical from run to run.
inline Uuid benchUuid(uint8_t seed)
{
    Uuid::Bytes bytes {};
    for (size_t i = 0; i < bytes.size(); ++i)
        bytes[i] = static_cast<uint8_t>(seed * 31 + i * 7);
    bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0f) | 0x40);
    bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3f) | 0x80);
    return Uuid(bytes);
}

// About 40 keys, nested: what a plug-in bundle's Info.vlist holds once registered.
inline Value pluginInfoDictionary()
{
    std::vector<uint8_t> blob(96);
    for (size_t i = 0; i < blob.size(); ++i)
        blob[i] = static_cast<uint8_t>(i * 13 + 5);

    Value activationRule = Value::dictionary({
        { "text/plain", Value::integer(1) },
        { "image/png", Value::integer(10) },
        { "image/jpeg", Value::integer(10) },
        { "application/pdf", Value::integer(1) },
        { "text/uri-list", Value::integer(5) },
    });
    Value extension = Value::dictionary({
        { "QSExtensionPointIdentifier", "com.orvex.share-services" },
        { "QSExtensionAttributes",
            Value::dictionary({
                { "QSExtensionActivationRule", activationRule },
                { "QSExtensionServiceAllowsPreviewItem", Value::boolean(true) },
                { "QSExtensionServiceRoleType", "QSExtensionServiceRoleTypeEditor" },
                { "QSExtensionMaximumItems", Value::integer(20) },
            }) },
        { "QSExtensionPrincipalClass", "NotesShareViewController" },
        { "QSExtensionMainLayout", "ShareSheet" },
        { "QSExtensionSharedResources",
            Value::array({ "Resources/icon-29.png", "Resources/icon-40.png", "Resources/icon-60.png",
                "Resources/Localizable.strings", "Resources/ShareSheet.layout" }) },
    });

    return Value::dictionary({
        { "VBBundleIdentifier", "com.example.notes.share" },
        { "VBBundleVersion", "1487.3.2" },
        { "VBBundleShortVersionString", "4.12" },
        { "VBBundleName", "Notes Share" },
        { "VBBundleDisplayName", "Share to Notes" },
        { "VBBundleExecutable", "NotesShare" },
        { "VBBundlePackageType", "OMPX" },
        { "VBBundleSignature", "????" },
        { "VBBundleDevelopmentRegion", "en" },
        { "VBBundleInfoDictionaryVersion", "6.0" },
        { "VBBundleSupportedPlatforms", Value::array({ "OrvexOS", "OrvexOSSimulator" }) },
        { "VBBundleIcons",
            Value::dictionary({ { "VBBundlePrimaryIcon",
                Value::dictionary({ { "VBBundleIconName", "AppIcon" },
                    { "VBBundleIconFiles", Value::array({ "AppIcon29x29", "AppIcon40x40" }) } }) } }) },
        { "DTCompiler", "com.orvex.compilers.llvm.clang.1_0" },
        { "DTPlatformBuild", "21A5268h" },
        { "DTPlatformName", "orvexos" },
        { "DTPlatformVersion", "17.0" },
        { "DTSDKBuild", "21A5268h" },
        { "DTSDKName", "orvexos17.0" },
        { "DTToolchainBuild", "15A5160n" },
        { "DTToolchainVersion", "15.0" },
        { "DTToolsVersion", Value::integer(1500) },
        { "DTToolsBuild", "15A5160n" },
        { "MinimumOSVersion", "16.0" },
        { "VBDeviceFamily", Value::array({ Value::integer(1), Value::integer(2) }) },
        { "VBRequiredDeviceCapabilities", Value::array({ "arm64" }) },
        { "QSExtension", extension },
        { "QSExtensionSDKVersion", Value::integer(3) },
        { "VBBuildMachineOSBuild", "22G90" },
        { "VBBundleSequenceNumber", Value::integer(48213) },
        { "VBBundleFileSize", Value::unsignedInteger(uint64_t { 18446744073709551000u }) },
        { "VBBundleRequiresFullScreen", Value::boolean(false) },
        { "VBBundleUUID", Value::uuid(benchUuid(1)) },
        { "VBBundleInstallDate", Value::date(1700000000.25) },
        { "VBBundleRating", Value::real(4.75) },
        { "VBBundleSignatureHash", Value::data(blob) },
        { "VBBundleLocalizations", Value::array({ "en", "fr", "de", "ja", "zh-Hans", "es" }) },
        { "VBBundleURLTypes",
            Value::array({ Value::dictionary({ { "VBBundleURLName", "com.example.notes" },
                { "VBBundleURLSchemes", Value::array({ "notes", "x-notes" }) } }) }) },
        { "VBNetworkSecurity", Value::dictionary({ { "AllowsInsecureConnections", Value::boolean(false) } }) },
        { "VBBundleMinimumLaunchTime", Value::integer(-250) },
        { "VBBundleAlternateExecutables", Value::array({}) },
    });
}

// n entries keyed "com.example.app<i>.plugin", each {"election": 0/1, "extension": {"lastUsed":
// date, "host": string}}: the shape of the persisted per-user annotations.
inline Value annotationTable(size_t n = 1000)
{
    std::vector<Value::Entry> entries;
    entries.reserve(n);
    for (size_t i = 0; i < n; ++i) {
        Value extension = Value::dictionary({
            { "lastUsed", Value::date(1700000000.0 + static_cast<double>(i) * 37.5) },
            { "host", "com.example.host" + std::to_string(i % 17) },
        });
        entries.emplace_back("com.example.app" + std::to_string(i) + ".plugin",
            Value::dictionary({ { "election", Value::integer(static_cast<int>(i % 2)) }, { "extension", extension } }));
    }
    return Value::dictionary(std::move(entries));
}

// About 300 bytes once encoded: a typical discovery request as a client sends it.
inline Value requestDictionary()
{
    return Value::dictionary({
        { "name", "match" },
        { "version", Value::integer(3) },
        { "flags", Value::integer(5) },
        { "rules",
            Value::dictionary({
                { "QSExtensionPointIdentifier", "com.orvex.share-services" },
                { "VBBundleIdentifier", "com.example.notes.share" },
                { "QSExtensionActivationRule",
                    Value::dictionary({ { "types", Value::array({ "text/plain", "image/png" }) } }) },
            }) },
        { "uuids", Value::array({ Value::uuid(benchUuid(2)), Value::uuid(benchUuid(3)), Value::uuid(benchUuid(4)) }) },
        { "limit", Value::integer(100) },
        { "includeHidden", Value::boolean(false) },
    });
}

} // namespace om::bench
