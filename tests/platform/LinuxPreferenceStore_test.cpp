#include "platform/linux/LinuxPreferenceStore.h"
#include "fakes/TempDirectory.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <limits>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

namespace qv {
namespace {

namespace fs = std::filesystem;

class ALinuxPreferenceStore : public ::testing::Test {
  protected:
    void SetUp() override { stateDir = root / "state"; }

    LinuxPreferenceStore::ErrorCallback recordErrors() {
        return [this](const std::string& message) {
            std::lock_guard lock(errorsMutex);
            errors.push_back(message);
        };
    }
    std::vector<std::string> errorsSoFar() {
        std::lock_guard lock(errorsMutex);
        return errors;
    }
    static void writeText(const fs::path& path, const std::string& text) {
        std::ofstream out(path, std::ios::binary | std::ios::trunc);
        out << text;
    }
    static std::string readText(const fs::path& path) {
        std::ifstream in(path, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    // Every file below root, as paths relative to it.
    std::set<std::string> filesBelowRoot() const {
        std::set<std::string> files;
        for (const auto& entry : fs::recursive_directory_iterator(root)) {
            if (!entry.is_directory()) {
                files.insert(fs::relative(entry.path(), root).string());
            }
        }
        return files;
    }

    test::TempDirectory tmp{"qvprefs"};
    const fs::path root = tmp.path();
    fs::path stateDir;
    std::mutex errorsMutex;
    std::vector<std::string> errors;
};

TEST_F(ALinuxPreferenceStore, WritesAtomicallyAndASecondStoreReadsEveryKindOfValue) {
    LinuxPreferenceStore writer(stateDir.string(), recordErrors());
    const Dictionary entries{{"flag", Value(true)},
                             {"count", Value(std::int64_t{-7})},
                             {"big", Value(std::numeric_limits<std::uint64_t>::max())},
                             {"ratio", Value(0.1 + 0.2)},
                             {"nested", Value(Dictionary{{"inner", Value(Array{1, "two"})}})}};
    for (const auto& [key, value] : entries) {
        ASSERT_TRUE(writer.setValue("com.korvane.qvsound", key, value));
    }
    ASSERT_TRUE(writer.setValue("com.korvane.qvsound", "flag", Value(true)));  // keeps its place

    // No temporary file is left behind.
    EXPECT_EQ(filesBelowRoot(), (std::set<std::string>{"state/defaults/com.korvane.qvsound.json"}));
    struct stat info {};
    ASSERT_EQ(::stat((stateDir / "defaults/com.korvane.qvsound.json").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0644u);

    LinuxPreferenceStore reader(stateDir.string(), recordErrors());
    const Dictionary read = reader.values("com.korvane.qvsound");
    EXPECT_EQ(read, entries);
    ASSERT_TRUE(std::equal(read.begin(), read.end(), entries.begin(), entries.end(),
                           [](const auto& x, const auto& y) {
                               return x.first == y.first && x.second.kind() == y.second.kind();
                           }));
    EXPECT_FALSE(reader.value("com.korvane.qvsound", "absent"));
    EXPECT_TRUE(errorsSoFar().empty());
}

TEST_F(ALinuxPreferenceStore, SeesChangesMadeByOtherWritersEvenWithinOneTimestampTick) {
    LinuxPreferenceStore store(stateDir.string(), recordErrors());
    LinuxPreferenceStore other(stateDir.string(), recordErrors());
    ASSERT_TRUE(store.setValue("suite", "k", Value(1)));
    EXPECT_EQ(store.value("suite", "k"), Value(1));
    ASSERT_TRUE(other.setValue("suite", "k", Value(2)));
    EXPECT_EQ(store.value("suite", "k"), Value(2));

    // Rewritten in place with the same size right after a read, within one file-clock tick.
    const fs::path file = store.pathForSuite("suite");
    writeText(file, R"({"k": 3})");
    const auto tick = fs::last_write_time(file);
    EXPECT_EQ(store.value("suite", "k"), Value(3));
    writeText(file, R"({"k": 4})");
    fs::last_write_time(file, tick);
    EXPECT_EQ(store.value("suite", "k"), Value(4));

    fs::remove(file);
    EXPECT_TRUE(store.values("suite").empty());
    ASSERT_TRUE(other.setValue("suite", "a", Value("x")));
    ASSERT_TRUE(other.setValue("suite", "b", Value("y")));
    EXPECT_TRUE(store.removeValue("suite", "a"));
    EXPECT_TRUE(store.removeValue("suite", "never-there"));
    EXPECT_EQ(other.values("suite"), (Dictionary{{"b", Value("y")}}));
    EXPECT_TRUE(errorsSoFar().empty());
}

TEST_F(ALinuxPreferenceStore, ReadsMalformedFilesAsEmptyReportsEachVersionOnceAndLeavesThemAlone) {
    LinuxPreferenceStore store(stateDir.string(), recordErrors());
    const fs::path bad = store.pathForSuite("bad");
    writeText(bad, "{\"k\": 1, oops");
    for (int i = 0; i < 3; ++i) {
        EXPECT_FALSE(store.value("bad", "k"));
    }
    ASSERT_EQ(errorsSoFar().size(), 1u);
    EXPECT_NE(errorsSoFar()[0].find(bad.string()), std::string::npos);
    EXPECT_NE(errorsSoFar()[0].find("not valid JSON"), std::string::npos);
    // An older time is another version of the file.
    fs::last_write_time(bad, fs::last_write_time(bad) - std::chrono::seconds(10));
    EXPECT_TRUE(store.values("bad").empty());
    EXPECT_EQ(errorsSoFar().size(), 2u);
    // A change would throw the rest of the file away: refused, file untouched.
    EXPECT_FALSE(store.setValue("bad", "k", Value(2)));
    EXPECT_EQ(readText(bad), "{\"k\": 1, oops");

    writeText(store.pathForSuite("array"), "[1, 2]");
    writeText(store.pathForSuite("deep"), std::string(100000, '[') + std::string(100000, ']'));
    fs::create_directory(store.pathForSuite("directory"));
    for (const char* suite : {"array", "deep", "directory"}) {
        EXPECT_TRUE(store.values(suite).empty()) << suite;
    }
    EXPECT_FALSE(store.setValue("directory", "k", Value(1)));
    EXPECT_TRUE(fs::is_directory(store.pathForSuite("directory")));

    writeText(bad, R"({"k": 5, "ok": true})");
    EXPECT_TRUE(store.setValue("bad", "k", Value(6)));
    EXPECT_EQ(store.values("bad"), (Dictionary{{"k", Value(6)}, {"ok", Value(true)}}));
}

TEST_F(ALinuxPreferenceStore, KeepsHostileSuiteNamesInsideItsDirectoryAndApart) {
    LinuxPreferenceStore store(stateDir.string(), recordErrors());
    const std::string names[] = {"../../etc/x",
                                 "/abs",
                                 "a/b",
                                 "a_b",
                                 "..",
                                 ".",
                                 "",
                                 std::string("nul\0x", 5),
                                 "line\nfeed",
                                 std::string(10000, 'n')};
    for (std::size_t i = 0; i < std::size(names); ++i) {
        ASSERT_TRUE(store.setValue(names[i], "i", Value(static_cast<std::int64_t>(i)))) << names[i];
    }
    for (std::size_t i = 0; i < std::size(names); ++i) {
        EXPECT_EQ(store.value(names[i], "i"), Value(static_cast<std::int64_t>(i))) << names[i];
    }
    const auto files = filesBelowRoot();
    EXPECT_EQ(files.size(), std::size(names));
    for (const auto& file : files) {
        EXPECT_EQ(fs::path(file).parent_path(), fs::path("state/defaults")) << file;
    }
    EXPECT_TRUE(errorsSoFar().empty());
}

TEST_F(ALinuxPreferenceStore, CreatesItsDirectoryAgainAndFailsCleanlyWhenItCannot) {
    LinuxPreferenceStore store(stateDir.string(), recordErrors());
    fs::remove_all(stateDir);
    EXPECT_TRUE(store.setValue("suite", "k", Value(1)));
    EXPECT_EQ(store.value("suite", "k"), Value(1));

    // A file where the directory should be: writes fail and say why; reads are empty.
    const fs::path blocked = root / "blocked";
    fs::create_directories(blocked);
    writeText(blocked / "defaults", "a file, not a directory");
    LinuxPreferenceStore broken(blocked.string(), recordErrors());
    const std::size_t before = errorsSoFar().size();
    EXPECT_GE(before, 1u);
    EXPECT_FALSE(broken.setValue("suite", "k", Value(1)));
    EXPECT_GT(errorsSoFar().size(), before);
    EXPECT_TRUE(broken.values("suite").empty());
}

TEST_F(ALinuxPreferenceStore, LosesNoWriteWhenStoresWriteOneSuiteAtOnce) {
    // Two stores stand for two processes: only the lock on the directory keeps them apart.
    LinuxPreferenceStore first(stateDir.string(), recordErrors());
    LinuxPreferenceStore second(stateDir.string(), recordErrors());
    constexpr int kKeysPerThread = 20;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            LinuxPreferenceStore& store = t % 2 == 0 ? first : second;
            for (int i = 0; i < kKeysPerThread; ++i) {
                EXPECT_TRUE(store.setValue("shared", fmt::format("t{}_{}", t, i), Value(i)));
                (void)store.values("shared");
            }
        });
    }
    for (auto& thread : threads) {
        thread.join();
    }
    const Dictionary all = first.values("shared");
    EXPECT_EQ(all.size(), 4u * kKeysPerThread);
    EXPECT_EQ(all, second.values("shared"));
    EXPECT_TRUE(errorsSoFar().empty());
}

}  // namespace
}  // namespace qv
