#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <random>

#include "core/AtomicFile.h"
#include "fakes/TestPlatform.h"

namespace qax {
namespace {

// A writer killed at random moments leaves the file old or new, never torn: the child
// rewrites the file over and over with whole generations, the parent kills it with SIGKILL
// after a random pause and checks what is on disk.
TEST(AtomicFileTest, KilledWriterLeavesOldOrNewNeverTorn) {
    test::TempDir dir;
    const std::string path = (dir.path() / "state.plist").string();
    auto generation = [](int n) {
        return std::string(256 * 1024, static_cast<char>('a' + n % 26));
    };
    ASSERT_TRUE(writeFileAtomically(path, generation(0)));

    std::mt19937 rng(12345);
    std::uniform_int_distribution<int> pause(0, 4000);
    for (int round = 0; round < 40; ++round) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            for (int n = 1;; ++n) {
                writeFileAtomically(path, generation(n));
            }
        }
        usleep(static_cast<useconds_t>(pause(rng)));
        kill(pid, SIGKILL);
        int status = 0;
        waitpid(pid, &status, 0);

        auto content = readWholeFile(path);
        ASSERT_TRUE(content);
        ASSERT_EQ(content->size(), 256u * 1024u) << "round " << round;
        EXPECT_EQ(content->find_first_not_of(content->front()), std::string::npos)
            << "torn file in round " << round;
    }
}

TEST(AtomicFileTest, FailedReplacementLeavesTheOldEntryAndNoLitter) {
    test::TempDir dir;
    // The target is a non-empty directory: the final rename fails, even for root.
    const auto target = dir.path() / "target";
    std::filesystem::create_directory(target);
    test::writeFile(target / "inside", "old");
    std::string error;
    EXPECT_FALSE(writeFileAtomically(target.string(), "new", &error));
    EXPECT_NE(error.find("cannot rename"), std::string::npos) << error;
    EXPECT_EQ(readWholeFile((target / "inside").string()), "old");
    std::size_t entries = 0;
    for (const auto& e : std::filesystem::directory_iterator(dir.path())) {
        (void)e;
        ++entries;
    }
    EXPECT_EQ(entries, 1u) << "the temporary file was removed";
    EXPECT_FALSE(readWholeFile((dir.path() / "missing").string()));
}

}  // namespace
}  // namespace qax
