#include "core/FileChangeMonitor.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <functional>

#include "core/AtomicFile.h"
#include "core/FileSnapshotScope.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

namespace fs = std::filesystem;

// Every way a file's content or presence can change is noticed; a reader that trusted a
// stamp past one of them would serve stale content.
TEST(FileChangeMonitorTest, EveryKindOfChangeVoidsTheStamp) {
    test::TempDir dir;
    const fs::path file = dir.path() / "device.plist";
    const fs::path sibling = dir.path() / "other.plist";
    const std::pair<const char*, std::function<void()>> rows[] = {
        {"rewritten in place", [&] { test::writeFile(file, "second"); }},
        {"replaced by a rename", [&] { ASSERT_TRUE(writeFileAtomically(file.string(), "new")); }},
        {"removed", [&] { fs::remove(file); }},
        {"created", [&] { test::writeFile(file, "again"); }},
        {"its mode changed", [&] { fs::permissions(file, fs::perms::owner_read); }},
        {"its times set back",
         [&] {
             const timespec times[2] = {{0, 0}, {1, 0}};
             utimensat(AT_FDCWD, file.c_str(), times, 0);
         }},
        {"another file of the directory written", [&] { test::writeFile(sibling, "x"); }},
    };
    FileChangeMonitor& monitor = FileChangeMonitor::shared();
    test::writeFile(file, "first");
    for (const auto& [change, make] : rows) {
        const std::uint64_t stamp = monitor.stamp(file.string());
        ASSERT_NE(stamp, 0u) << change;
        EXPECT_TRUE(monitor.holds(file.string(), stamp)) << "nothing changed yet: " << change;
        make();
        EXPECT_FALSE(monitor.holds(file.string(), stamp)) << change;
    }
}

// Where nothing can be promised, the stamp is unknown and never holds; a directory that goes
// away and comes back is watched afresh.
TEST(FileChangeMonitorTest, UnknownStampsAndReplacedDirectories) {
    test::TempDir dir;
    FileChangeMonitor& monitor = FileChangeMonitor::shared();
    const fs::path missing = dir.path() / "absent" / "device.plist";
    EXPECT_EQ(monitor.stamp(missing.string()), 0u) << "no directory to watch";

    const fs::path target = dir.path() / "target.plist";
    const fs::path link = dir.path() / "link.plist";
    test::writeFile(target, "content");
    fs::create_symlink(target, link);
    EXPECT_EQ(monitor.stamp(link.string()), 0u) << "a link's target may change elsewhere";

    const fs::path root = dir.path() / "root";
    const fs::path file = root / "device.plist";
    fs::create_directory(root);
    test::writeFile(file, "one");
    const std::uint64_t stamp = monitor.stamp(file.string());
    fs::rename(root, dir.path() / "old-root");
    fs::create_directory(root);
    test::writeFile(file, "two");
    EXPECT_FALSE(monitor.holds(file.string(), stamp));
    const std::uint64_t next = monitor.stamp(file.string());
    EXPECT_NE(next, 0u);
    EXPECT_TRUE(monitor.holds(file.string(), next));
    test::writeFile(file, "three");
    EXPECT_FALSE(monitor.holds(file.string(), next)) << "the new directory is watched";
}

// Within one piece of work the notices are read once: the work sees the files as they stood
// at its first question, and the next piece of work sees the change.
TEST(FileChangeMonitorTest, APieceOfWorkSeesOneMoment) {
    test::TempDir dir;
    const fs::path file = dir.path() / "device.plist";
    test::writeFile(file, "first");
    FileChangeMonitor& monitor = FileChangeMonitor::shared();
    const std::uint64_t stamp = monitor.stamp(file.string());
    {
        FileSnapshotScope work;
        EXPECT_TRUE(monitor.holds(file.string(), stamp));
        test::writeFile(file, "second");
        EXPECT_TRUE(monitor.holds(file.string(), stamp));
    }
    FileSnapshotScope next;
    EXPECT_FALSE(monitor.holds(file.string(), stamp));
}

}  // namespace
}  // namespace qax
