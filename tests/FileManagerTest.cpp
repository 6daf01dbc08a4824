#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <vector>

#include "platform/FileManager.h"
#include "platform/host/Descriptor.h"
#include "platform/host/HostFileManager.h"
#include "platform/host/HostRuntime.h"
#include "platform/simulated/SimulatedFileManager.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform {
namespace {

std::int64_t errorOf(const auto& result) {
  return result ? 0 : result.error().code;
}

mode_t modeOf(const std::filesystem::path& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

struct FileManagerContract : testing::TestWithParam<bool> {
  TemporaryFolder folder;
  simulated::SimulatedRuntime clock;
  std::unique_ptr<FileManager> files = makeFiles();

  std::unique_ptr<FileManager> makeFiles() {
    if (GetParam()) return std::make_unique<host::HostFileManager>(folder.folders());
    return std::make_unique<simulated::SimulatedFileManager>(clock);
  }
};

TEST_P(FileManagerContract, WhatIsWrittenIsReadUntilItIsRemoved) {
  const auto caches = files->cachesDirectory();
  ASSERT_TRUE(caches);
  const auto file = *caches / "com.kestrel.sabled" / "bag.plist";
  EXPECT_EQ(errorOf(files->writeAtomically(file, "early")), ENOENT);
  ASSERT_TRUE(files->createDirectory(file.parent_path()));
  ASSERT_TRUE(files->createDirectory(file.parent_path()));

  for (const std::string& bytes : {std::string("first"), std::string(), std::string(100'000, '\0')}) {
    ASSERT_TRUE(files->writeAtomically(file, bytes));
    EXPECT_EQ(*files->read(file, bytes.size()), bytes);
    EXPECT_EQ(errorOf(files->read(file, bytes.size() - 1)), bytes.empty() ? 0 : EFBIG);
  }
  EXPECT_TRUE(files->remove(file));
  EXPECT_EQ(errorOf(files->remove(file)), ENOENT);
  EXPECT_EQ(errorOf(files->read(file, 10)), ENOENT);
  EXPECT_EQ(errorOf(files->read(file.parent_path(), 10)), EISDIR);
  EXPECT_EQ(errorOf(files->writeAtomically(file.parent_path(), "x")), EISDIR);
}

TEST_P(FileManagerContract, AFileGrowsAtItsEndAndIsMappedWhole) {
  const auto parent = *files->cachesDirectory();
  const auto file = parent / "session.0";
  EXPECT_EQ(errorOf(files->openForAppending(file)), ENOENT);
  EXPECT_EQ(errorOf(files->openForReading(file)), ENOENT);
  EXPECT_EQ(errorOf(files->attributes(file)), ENOENT);
  EXPECT_EQ(errorOf(files->createFile(parent / "missing" / "file")), ENOENT);
  ASSERT_TRUE(files->createFile(file));
  EXPECT_EQ(errorOf(files->createFile(file)), EEXIST);
  EXPECT_EQ((*files->openForReading(file))->map(0), "");

  const auto first = *files->openForAppending(file);
  ASSERT_TRUE(first->append("head", std::string(100'000, 'x')));
  const auto second = *files->openForAppending(file);
  ASSERT_TRUE(second->append("", "tail"));
  ASSERT_TRUE(first->append("", ""));
  EXPECT_EQ(first->size(), 100'008u);
  EXPECT_EQ(files->attributes(file)->size, 100'008u);
  const auto readable = *files->openForReading(file);
  EXPECT_EQ(errorOf((*files->openForReading(file))->map(100'007)), EFBIG);
  EXPECT_EQ(readable->map(100'008), "head" + std::string(100'000, 'x') + "tail");
}

TEST_P(FileManagerContract, AFileTakesThePlaceOfAnotherAndWhoHasTheOldOneOpenKeepsIt) {
  const auto parent = *files->cachesDirectory();
  const auto file = parent / std::string(255, 'n'), arrived = parent / "arrived";
  EXPECT_EQ(errorOf(files->replaceItem(file, arrived)), ENOENT);
  ASSERT_TRUE(files->writeAtomically(arrived, "old"));
  ASSERT_TRUE(files->replaceItem(file, arrived));
  EXPECT_EQ(errorOf(files->read(arrived, 10)), ENOENT);
  const auto old = *files->openForReading(file);

  ASSERT_TRUE(files->writeAtomically(arrived, "newer"));
  EXPECT_EQ(errorOf(files->replaceItem(parent / "missing" / "file", arrived)), ENOENT);
  ASSERT_TRUE(files->createDirectory(parent / "folder"));
  EXPECT_EQ(errorOf(files->replaceItem(parent / "folder", arrived)), EISDIR);
  ASSERT_TRUE(files->replaceItem(file, arrived));
  EXPECT_EQ(*files->read(file, 10), "newer");
  EXPECT_EQ(old->attributes()->size, 3u);

  const auto descriptor = old->descriptor();
  ASSERT_TRUE(descriptor);
  char bytes[10];
  EXPECT_EQ(read(**descriptor, bytes, sizeof bytes), 3) << "from its beginning";
  EXPECT_LT(write(**descriptor, "x", 1), 0) << "for reading only";
}

TEST_P(FileManagerContract, AFolderIsListedInOrderAndIsNoFile) {
  const auto parent = *files->cachesDirectory();
  EXPECT_EQ(files->list(parent), std::vector<std::string>{});
  ASSERT_TRUE(files->createDirectory(parent / "b" / "below"));
  for (const char* name : {"c", "a"}) ASSERT_TRUE(files->createFile(parent / name));
  EXPECT_EQ(files->list(parent), (std::vector<std::string>{"a", "b", "c"}));
  EXPECT_EQ(errorOf(files->list(parent / "missing")), ENOENT);
  EXPECT_EQ(errorOf(files->list(parent / "a")), ENOTDIR);

  EXPECT_EQ(errorOf(files->createFile(parent / "b")), EEXIST);
  EXPECT_EQ(errorOf(files->openForAppending(parent / "b")), EISDIR);
  EXPECT_EQ(errorOf(files->openForReading(parent / "b")), EISDIR);
  EXPECT_EQ(errorOf(files->attributes(parent / "b")), EISDIR);
}

INSTANTIATE_TEST_SUITE_P(Both, FileManagerContract, testing::Bool(),
                         [](const auto& each) { return each.param ? "Host" : "Simulated"; });

struct HostFileManagerTest : testing::Test {
  TemporaryFolder folder;
  host::HostFileManager files{folder.folders()};
};

TEST_F(HostFileManagerTest, FilesAndFoldersAreForTheirOwnerOnly) {
  const mode_t before = umask(0);
  ASSERT_TRUE(files.createDirectory(folder / "a/b"));
  ASSERT_TRUE(files.writeAtomically(folder / "a/b/file", "x"));
  ASSERT_TRUE(files.createFile(folder / "made"));
  umask(before);
  EXPECT_EQ(modeOf(folder / "a"), 0700u);
  EXPECT_EQ(modeOf(folder / "a/b"), 0700u);
  EXPECT_EQ(modeOf(folder / "a/b/file"), 0600u);
  EXPECT_EQ(modeOf(folder / "made"), 0600u);

  writeFile(folder / "open", "old");
  ASSERT_EQ(chmod((folder / "open").c_str(), 0666), 0);
  ASSERT_TRUE(files.writeAtomically(folder / "open", "new"));
  EXPECT_EQ(modeOf(folder / "open"), 0600u);
}

TEST_F(HostFileManagerTest, WhatIsNoRegularFileIsNeitherReadNorMadeNorAppendedTo) {
  writeFile(folder / "file", "untouched");
  ASSERT_EQ(symlink("absent", (folder / "dangling").c_str()), 0);
  ASSERT_EQ(symlink("file", (folder / "link").c_str()), 0);
  ASSERT_EQ(mkfifo((folder / "fifo").c_str(), 0600), 0);
  for (const char* name : {"dangling", "link", "fifo"}) {
    EXPECT_EQ(errorOf(files.createFile(folder / name)), EEXIST) << name;
    EXPECT_FALSE(files.openForAppending(folder / name)) << name;
    EXPECT_FALSE(files.openForReading(folder / name)) << name;
    EXPECT_FALSE(files.attributes(folder / name)) << name;
  }
  EXPECT_FALSE(std::filesystem::exists(folder / "absent"));
  EXPECT_EQ(errorOf(files.openForAppending(folder / "link")), ELOOP);
  EXPECT_EQ(errorOf(files.attributes(folder / "fifo")), EINVAL);
  EXPECT_EQ(errorOf(files.read(folder / "link", 100)), ELOOP);
  EXPECT_EQ(errorOf(files.read(folder / "fifo", 100)), EINVAL);
  EXPECT_EQ(errorOf(files.read("/dev/null", 100)), EINVAL);

  ASSERT_TRUE(files.writeAtomically(folder / "link", "new")) << "a link is replaced, not followed";
  EXPECT_EQ(readFile(folder / "file"), "untouched");
  EXPECT_EQ(*files.read(folder / "link", 100), "new");
}

TEST_F(HostFileManagerTest, AMappedFileCannotBeCutUnderItsReader) {
  writeFile(folder / "file", std::string(10'000, 'x'));
  const auto path = folder / "file";
  {
    const auto readable = *files.openForReading(path);
    const auto bytes = readable->map(10'000);
    ASSERT_TRUE(bytes);
    EXPECT_EQ(open(path.c_str(), O_WRONLY | O_TRUNC | O_NONBLOCK | O_CLOEXEC), -1);
    EXPECT_EQ(errno, EWOULDBLOCK);
    EXPECT_EQ(*bytes, std::string(10'000, 'x'));
  }
  const host::Descriptor writer(open(path.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC));
  ASSERT_TRUE(writer) << "the file is free again";
  const auto readable = *files.openForReading(path);
  const auto bytes = readable->map(10'000);
  ASSERT_EQ(ftruncate(writer.number(), 0), 0);
  EXPECT_EQ(bytes, std::string(10'000, 'x')) << "what somebody holds open for writing is copied";
}

TEST_F(HostFileManagerTest, ADiskThatIsFullTakesWhatItCanAndSaysSo) {
  ASSERT_TRUE(files.createFile(folder / "file"));
  const auto file = *files.openForAppending(folder / "file");
  EXPECT_EQ(errorOf(withRoomFor(10, [&] { return file->append("12345678", "abcd"); })), EFBIG);
  EXPECT_EQ(readFile(folder / "file"), "12345678ab");
}

TEST_F(HostFileManagerTest, ACopyIsAsOldAsWhatItWasCopiedFrom) {
  const auto start = std::filesystem::file_time_type::clock::now() - std::chrono::hours(1);
  writeFile(folder / "file", "x");
  const WallTime created = files.attributes(folder / "file")->creationDate;
  std::filesystem::last_write_time(folder / "file", start);
  EXPECT_NEAR(toSeconds(created - files.attributes(folder / "file")->creationDate), 3600, 60);
}

TEST_F(HostFileManagerTest, FoldersAreReachedThroughOwnLinksButNotThroughAStrangers) {
  writeFile(folder / "real/file", "text");
  ASSERT_EQ(symlink("real", (folder / "relative").c_str()), 0);
  ASSERT_EQ(symlink((folder / "relative").c_str(), (folder / "absolute").c_str()), 0);
  ASSERT_EQ(symlink("loop", (folder / "loop").c_str()), 0);
  EXPECT_EQ(*files.read(folder / "absolute/../real/file", 100), "text");
  EXPECT_EQ(errorOf(files.read(folder / "loop/file", 100)), ELOOP);
  EXPECT_EQ(errorOf(files.read(folder / "real/file/file", 100)), ENOTDIR);

  if (geteuid() != 0) GTEST_SKIP() << "needs root to give a link away";
  ASSERT_EQ(lchown((folder / "relative").c_str(), 12345, 12345), 0);
  EXPECT_EQ(errorOf(files.read(folder / "absolute/file", 100)), ELOOP);
  EXPECT_EQ(errorOf(files.writeAtomically(folder / "relative/file", "x")), ELOOP);
  EXPECT_EQ(errorOf(files.createDirectory(folder / "relative/below")), ELOOP);
  EXPECT_EQ(readFile(folder / "real/file"), "text");
}

TEST_F(HostFileManagerTest, WhatAKilledWriterLeftIsUsedAgain) {
  writeFile(folder / "file", "old");
  writeFile(folder / ".file.new", "half of a much longer tex");
  ASSERT_TRUE(files.writeAtomically(folder / "file", "new"));
  EXPECT_EQ(readFile(folder / "file"), "new");
  EXPECT_FALSE(std::filesystem::exists(folder / ".file.new"));

  std::filesystem::create_directory(folder / "folder");
  EXPECT_EQ(errorOf(files.writeAtomically(folder / "folder", "x")), EISDIR);
  EXPECT_FALSE(std::filesystem::exists(folder / ".folder.new")) << "a failed write leaves nothing";
}

TEST_F(HostFileManagerTest, ReadersSeeOneOfTheTextsWholeWhileSeveralWrite) {
  const auto path = folder / "file";
  ASSERT_TRUE(files.writeAtomically(path, std::string(5000, 'a')));
  host::HostRuntime runtime(3);
  const auto writers = runtime.waitGroup();
  for (const char letter : {'b', 'c', 'd'}) {
    writers->enter();
    runtime.globalQueue(QualityOfService::standard).async([&, letter] {
      for (std::size_t i = 1; i <= 50; ++i)
        EXPECT_TRUE(files.writeAtomically(path, std::string(i * 100, letter)));
      writers->leave();
    });
  }
  do {
    const auto text = files.read(path, 10'000);
    ASSERT_TRUE(text) << text.error().reason;
    EXPECT_EQ(text->find_first_not_of(text->front()), std::string::npos);
    EXPECT_EQ(text->size() % 100, 0u);
  } while (!writers->wait(MonotonicTime{}));
  EXPECT_FALSE(std::filesystem::exists(folder / ".file.new"));
}

TEST_F(HostFileManagerTest, AFileFromAnotherFileSystemArrivesWholeOrNotAtAll) {
  struct stat here {
  }, there{};
  if (stat(folder.path().c_str(), &here) != 0 || stat("/dev/shm", &there) != 0 || here.st_dev == there.st_dev)
    GTEST_SKIP() << "needs a second file system";
  const TemporaryFolder other("/dev/shm");
  const std::string bytes(200'000, 'n');
  writeFile(folder / "file", "old");
  writeFile(other / "arrived", bytes);
  const auto failed =
      withRoomFor(100'000, [&] { return files.replaceItem(folder / "file", other / "arrived"); });
  EXPECT_EQ(errorOf(failed), EFBIG) << "the disk was full half-way";
  EXPECT_EQ(readFile(folder / "file"), "old");
  EXPECT_FALSE(std::filesystem::exists(folder / ".file.new"));

  ASSERT_TRUE(files.replaceItem(folder / "file", other / "arrived"));
  EXPECT_EQ(readFile(folder / "file"), bytes);
  EXPECT_EQ(modeOf(folder / "file"), 0600u);
  EXPECT_FALSE(std::filesystem::exists(other / "arrived"));
}

TEST(FoldersTest, TheFirstVariableThatIsSetDecides) {
  const auto foldersOf = [](const std::map<std::string, std::string>& variables) {
    return host::Folders::fromEnvironment([&](const char* name) -> std::optional<std::string> {
      const auto found = variables.find(name);
      return found == variables.end() ? std::nullopt : std::optional(found->second);
    });
  };
  const auto byHome = foldersOf({{"HOME", "/h"}});
  EXPECT_EQ(byHome.runtime, "/run/user/" + std::to_string(getuid()) + "/com.kestrel.sabled");
  EXPECT_EQ(byHome.caches, "/h/.cache/com.kestrel.sabled");
  EXPECT_EQ(byHome.state, "/h/.local/state/com.kestrel.sabled");
  EXPECT_EQ(byHome.config, "/h/.config/com.kestrel.sabled");
  EXPECT_EQ(byHome.profileSettings, "/etc/com.kestrel.sabled/defaults.toml");
  std::map<std::string, std::string> variables{{"HOME", "/h"},
                                               {"XDG_RUNTIME_DIR", "/r"},
                                               {"XDG_CACHE_HOME", "/c"},
                                               {"XDG_STATE_HOME", "/s"},
                                               {"XDG_CONFIG_HOME", "relative"}};
  const auto byDesktop = foldersOf(variables);
  EXPECT_EQ(byDesktop.socket(), "/r/com.kestrel.sabled/relay.sock");
  EXPECT_EQ(byDesktop.caches, "/c/com.kestrel.sabled");
  EXPECT_EQ(byDesktop.state, "/s/com.kestrel.sabled");
  EXPECT_EQ(byDesktop.config, "/h/.config/com.kestrel.sabled");
  for (const char* name : {"RUNTIME_DIR", "CACHES_DIR", "STATE_DIR", "CONFIG_DIR", "PROFILE"})
    variables[std::string("SABLED_") + name] = std::string("/own/") + name;
  const auto own = foldersOf(variables);
  EXPECT_EQ(own.socket(), "/own/RUNTIME_DIR/relay.sock");
  EXPECT_EQ(own.caches, "/own/CACHES_DIR/com.kestrel.sabled");
  EXPECT_EQ(own.state, "/own/STATE_DIR");
  EXPECT_EQ(own.config, "/own/CONFIG_DIR");
  EXPECT_EQ(own.profileSettings, "/own/PROFILE");
}

}  // namespace
}  // namespace sable::platform
