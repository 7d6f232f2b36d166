// The host's IPC-side bindings against temporary directories: stream framing, the
// application registry's file-identity matching, the paired-device and feature files, socket
// path claiming and the notification socket.
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <future>

#include "core/PlistCodec.h"
#include "fakes/TestPlatform.h"
#include "platform/host/HostApplicationRegistry.h"
#include "platform/host/HostFeatureFlags.h"
#include "platform/host/HostNotificationSocket.h"
#include "platform/host/HostPairedDeviceRegistry.h"
#include "platform/host/HostUnixSocketPath.h"
#include "platform/host/IpcFrameCodec.h"

namespace qax {
namespace {

void writePlist(const std::filesystem::path& path, const Value& v) {
    test::writeFile(path, toXmlPlist(v).value());
}

TEST(IpcFrameCodecTest, FramesSurviveAnySplitOfTheStream) {
    std::string stream;
    std::vector<std::string> payloads = {"a", std::string(70'000, 'x'), "bc"};
    for (const auto& p : payloads) {
        stream += *IpcFrameCodec::frame(p);
    }
    for (std::size_t chunk : {1u, 3u, 4u, 5u, 4096u, 100'000u}) {
        IpcFrameCodec codec;
        std::vector<std::string> got;
        for (std::size_t at = 0; at < stream.size(); at += chunk) {
            codec.append(std::string_view(stream).substr(at, chunk));
            std::string payload;
            while (codec.next(payload) == IpcFrameCodec::Status::Frame) {
                got.push_back(payload);
            }
        }
        EXPECT_EQ(got, payloads) << "chunk " << chunk;
        EXPECT_FALSE(codec.hasPartialFrame());
    }
}

TEST(IpcFrameCodecTest, LengthLimits) {
    const std::pair<std::uint32_t, bool> headers[] = {{0, false},
                                                      {1, true},
                                                      {4 * 1024 * 1024, true},
                                                      {4 * 1024 * 1024 + 1, false},
                                                      {0xffffffffu, false}};
    for (const auto& [length, ok] : headers) {
        IpcFrameCodec codec;
        const char header[4] = {static_cast<char>(length >> 24), static_cast<char>(length >> 16),
                                static_cast<char>(length >> 8), static_cast<char>(length)};
        codec.append(std::string_view(header, 4));
        std::string payload, error;
        EXPECT_EQ(codec.next(payload, &error),
                  ok ? IpcFrameCodec::Status::NeedMore : IpcFrameCodec::Status::Error)
            << length;
        EXPECT_EQ(error.empty(), ok) << length;
    }
    EXPECT_FALSE(IpcFrameCodec::frame(""));
    EXPECT_FALSE(IpcFrameCodec::frame(std::string(4 * 1024 * 1024 + 1, 'x')));
    EXPECT_FALSE(IpcFrameCodec::encode(Value::Array{Value()})) << "a null has no plist form";
}

TEST(HostApplicationRegistryTest, ExecutablesMatchByFileIdentity) {
    test::TempDir dir;
    const auto bin = dir.path() / "bin";
    test::writeFile(bin / "settings", "#!/bin/true\n");
    test::writeFile(bin / "copy-of-settings", "#!/bin/true\n");
    std::filesystem::create_symlink(bin / "settings", bin / "link-to-settings");
    writePlist(dir.path() / "root/apps/settings.plist",
               Value::Dictionary{
                   {"BundleIdentifier", Value("com.velmora.Preferences")},
                   {"ExecutablePath", Value((bin / "settings").string())},
                   {"LocalizedName", Value("Settings")},
                   {"Installed", Value(true)},
                   {"Entitlements",
                    Value(Value::Dictionary{{"com.velmora.private.qaxagent", Value(true)}})}});
    writePlist(dir.path() / "root/apps/support.plist",
               Value::Dictionary{{"BundleIdentifier", Value("com.velmora.support")},
                                 {"VendorName", Value("Velmora")},
                                 {"Installed", Value(false)}});
    test::writeFile(dir.path() / "root/apps/broken.plist", "not a plist");
    test::writeFile(dir.path() / "root/apps/notes.txt", "ignored");

    HostApplicationRegistry registry((dir.path() / "root").string());
    const std::pair<std::filesystem::path, bool> paths[] = {
        {bin / "settings", true},
        {bin / "link-to-settings", true},
        {bin / "copy-of-settings", false},
        {bin / "missing", false},
    };
    for (const auto& [path, found] : paths) {
        auto app = registry.applicationForExecutablePath(path.string());
        EXPECT_EQ(app.has_value(), found) << path;
        EXPECT_EQ(registry.entitlementsForExecutablePath(path.string()).size(), found ? 1u : 0u)
            << path;
    }
    auto support = registry.applicationForBundleIdentifier("com.velmora.support");
    ASSERT_TRUE(support);
    EXPECT_FALSE(support->installed);
    EXPECT_EQ(support->vendorName, "Velmora");
    EXPECT_FALSE(registry.applicationForBundleIdentifier("com.velmora.nothing"));

    // Files are read afresh: removing the entitlement takes effect on the next look-up.
    writePlist(dir.path() / "root/apps/settings.plist",
               Value::Dictionary{{"ExecutablePath", Value((bin / "settings").string())}});
    EXPECT_TRUE(registry.entitlementsForExecutablePath((bin / "settings").string()).empty());
}

TEST(HostPlatformFilesTest, PairedDevicesAndFeatureFlags) {
    test::TempDir root;
    HostPairedDeviceRegistry registry(root.str());
    HostFeatureFlags flags(root.str());
    EXPECT_TRUE(registry.allDevicesMatching(nullptr).empty()) << "no file: no devices";
    EXPECT_FALSE(flags.isFeatureEnabled("Kestova", "Tessel_3_0"));

    writePlist(root.path() / "paired-devices.plist",
               Value::Array{
                   Value(Value::Dictionary{{"name", Value("W")},
                                           {"serialNumber", Value("S1")},
                                           {"pairedDate", Value(Date(1.6e9))},
                                           {"isPaired", Value(true)},
                                           {"isAltAccount", Value(true)}}),
                   Value("not a device"),
                   Value(Value::Dictionary{{"name", Value(42)}, {"isArchived", Value(true)}}),
               });
    auto all = registry.allDevicesMatching(nullptr);
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0].serialNumber, "S1");
    EXPECT_EQ(all[0].pairedDate, Date(1.6e9));
    EXPECT_TRUE(all[0].isPaired && all[0].isAltAccount && !all[0].isArchived);
    EXPECT_FALSE(all[1].name) << "a name of the wrong kind reads as absent";
    EXPECT_EQ(
        registry.allDevicesMatching([](const PairedDevice& d) { return d.isArchived; }).size(), 1u);

    writePlist(root.path() / "features.plist",
               Value::Dictionary{{"Kestova", Value(Value::Dictionary{{"Tessel_3_0", Value(true)},
                                                                     {"Other", Value(false)},
                                                                     {"Text", Value("YES")}})}});
    EXPECT_TRUE(flags.isFeatureEnabled("Kestova", "Tessel_3_0"));
    EXPECT_FALSE(flags.isFeatureEnabled("Kestova", "Other"));
    EXPECT_FALSE(flags.isFeatureEnabled("Kestova", "Text"));
    EXPECT_FALSE(flags.isFeatureEnabled("Elsewhere", "Tessel_3_0"));
}

TEST(HostUnixSocketPathTest, ClaimsFreeAndStalePathsButNotLiveOnes) {
    test::TempDir dir;
    const std::string path = (dir.path() / "run/sock").string();
    std::string error;
    ASSERT_TRUE(HostUnixSocketPath::claim(path, SOCK_DGRAM, &error)) << error;
    EXPECT_EQ(
        std::filesystem::status(dir.path() / "run").permissions() & std::filesystem::perms::all,
        std::filesystem::perms::owner_all);

    {
        HostNotificationSocket live(dir.path().string() + "/run");
        ASSERT_NE(live.subscribe([](const std::optional<std::string>&) {}), 0u);
        EXPECT_EQ(HostUnixSocketPath::probe(
                      HostNotificationSocket::socketPath(live.runtimeDirectory()), SOCK_DGRAM),
                  SocketPathState::InUse);
        HostNotificationSocket rival(dir.path().string() + "/run");
        EXPECT_EQ(rival.subscribe([](const std::optional<std::string>&) {}), 0u);
    }
    // Left behind by a process that is gone.
    const std::string stale = (dir.path() / "run/stale").string();
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    stale.copy(addr.sun_path, stale.size());
    ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
    ::close(fd);
    EXPECT_EQ(HostUnixSocketPath::probe(stale, SOCK_STREAM), SocketPathState::Stale);
    EXPECT_TRUE(HostUnixSocketPath::claim(stale, SOCK_STREAM, &error)) << error;
    EXPECT_FALSE(std::filesystem::exists(stale));

    EXPECT_FALSE(HostUnixSocketPath::claim("/tmp/" + std::string(200, 'x'), SOCK_STREAM, &error));
}

TEST(HostNotificationSocketTest, DeliversNamesToEverySubscriber) {
    test::TempDir dir;
    HostNotificationSocket socket(dir.str());
    std::promise<std::optional<std::string>> heard[2];
    std::vector<std::uint64_t> ids;
    for (auto& promise : heard) {
        ids.push_back(socket.subscribe([&promise](const auto& n) { promise.set_value(n); }));
        ASSERT_NE(ids.back(), 0u);
    }
    ASSERT_TRUE(HostNotificationSocket::post(dir.str(), "com.velmora.language.changed"));
    for (auto& promise : heard) {
        auto name = promise.get_future();
        ASSERT_EQ(name.wait_for(std::chrono::seconds(5)), std::future_status::ready);
        EXPECT_EQ(name.get(), "com.velmora.language.changed");
    }
    for (auto id : ids) {
        socket.unsubscribe(id);
    }
}

}  // namespace
}  // namespace qax
