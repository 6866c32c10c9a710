#include "FileSaver.h"

#include <sys/stat.h>

#include <cerrno>

#include "Fake.h"

namespace {

using fake::Folder;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using tether::FileMover;

// A file system that is another one, and whatever else a test breaks in it.
class Broken : public tether::FileCalls {
 public:
  int renameExclusively(const std::string& from, const std::string& to) override {
    const bool intoFolder = from.find("/.") == std::string::npos;  // not from the hidden name beside
    if (intoFolder && renameError != 0) return renameError;
    if (!intoFolder && placeError != 0) return placeError;
    return FileCalls::renameExclusively(from, to);
  }
  int link(const std::string& from, const std::string& to) override {
    return linkError != 0 ? linkError : FileCalls::link(from, to);
  }
  ssize_t write(int descriptor, const void* bytes, std::size_t count) override {
    if (room < count) {
      errno = ENOSPC;
      return -1;
    }
    room -= count;
    return FileCalls::write(descriptor, bytes, std::min(count, longestWrite));
  }
  int flush(int descriptor) override {
    if (beforeFlush) beforeFlush(descriptor);
    return --flushes == 0 ? EIO : FileCalls::flush(descriptor);
  }
  int remove(const std::string& path) override {
    if (beforeRemove) beforeRemove(path);
    return FileCalls::remove(path);
  }

  int renameError = EXDEV;
  int placeError = 0;
  int linkError = 0;
  int flushes = 0;  // the last of so many fails
  std::size_t room = SIZE_MAX / 2;
  std::size_t longestWrite = SIZE_MAX;
  std::function<void(int)> beforeFlush;
  std::function<void(const std::string&)> beforeRemove;
};

class FileMoverTest : public testing::Test {
 protected:
  Folder from;
  Folder to;
  Broken broken;
  const std::string content = std::string(3'000'000, 'x') + "end";
};

// A TIFF of one entry, with a text of ten bytes behind it.
std::string tiff(bool big, int tag, const std::string& text) {
  std::string bytes(big ? "MM\0*" : "II*\0", 4);
  const auto add = [&](int value, int size) {
    for (int i = 0; i < size; ++i) bytes += static_cast<char>(value >> 8 * (big ? size - 1 - i : i));
  };
  add(8, 4);
  for (const auto& [value, size] : {std::pair{1, 2}, {tag, 2}, {2, 2}, {10, 4}, {26, 4}}) add(value, size);
  return bytes + std::string(4, '\0') + text;
}

TEST_F(FileMoverTest, GivesDataTheExtensionThatItsContentSays) {
  FileMover mover(to.path());
  constexpr int kMake = 0x010F;
  const std::pair<std::string, const char*> kinds[] = {{tiff(false, kMake, std::string("SONY\0", 5)), "arw"},
                                                       {tiff(true, kMake, "PENTAX Corporation"), "pef"},
                                                       {tiff(true, 0xC612, ""), "dng"},
                                                       {tiff(false, kMake, "Somebody"), "tif"},
                                                       {tiff(false, 0xFFFF, "").substr(0, 9), "tif"},
                                                       {std::string("\0\0\0\x18"
                                                                    "ftypcrx \0\0\0\x01",
                                                                    16),
                                                        "cr3"},
                                                       {std::string("IIU\0\x18\0\0\0", 8), "rw2"},
                                                       {"FUJIFILMCCD-RAW 0201FF129502", "raf"},
                                                       {"no picture", "dat"},
                                                       {"", "dat"}};
  for (const auto& [bytes, extension] : kinds) {
    const auto moved = mover.move(from.write("Capture0001.dat", bytes), "Capture0001.dat");
    EXPECT_TRUE(std::filesystem::remove(to / (std::string("Capture0001.") + extension))) << moved.path;
  }
}

TEST_F(FileMoverTest, MovesAFileUnderItsAnnouncedNameReadableLikeAnyNewFile) {
  FileMover mover(to.path());
  const std::string source = from.write("Capture0001-1.jpg", content);
  std::filesystem::permissions(source, std::filesystem::perms(0600));
  const auto moved = mover.move(source, "Capture0001.jpg");
  EXPECT_TRUE(moved.moved) << moved.description;
  EXPECT_EQ(moved.path, to / "Capture0001.jpg");
  EXPECT_EQ(moved.size, 3'000'003);
  EXPECT_EQ(to.read("Capture0001.jpg"), content);
  EXPECT_THAT(from.names(), IsEmpty());
  EXPECT_EQ(std::filesystem::status(moved.path).permissions(),
            std::filesystem::status(to.write("new", "")).permissions());
}

TEST_F(FileMoverTest, NeverTakesThePlaceOfAFileAFolderOrALink) {
  to.write("a.jpg", "old");
  std::filesystem::create_directory(to / "a-2.jpg");
  std::filesystem::create_symlink(from / "elsewhere", to / "a-3.jpg");
  for (const int error : {0, EXDEV, EINVAL}) {
    broken.renameError = error;
    FileMover mover(to.path(), &broken);
    EXPECT_TRUE(mover.move(from.write("a.jpg", "new"), "a.jpg").moved);
  }
  EXPECT_THAT(to.names(), ElementsAre("a-2.jpg", "a-3.jpg", "a-4.jpg", "a-5.jpg", "a-6.jpg", "a.jpg"));
  EXPECT_EQ(to.read("a.jpg"), "old");
  EXPECT_THAT(from.names(), IsEmpty());  // nothing was written through the link either
}

TEST_F(FileMoverTest, WorksWhereTheFileSystemKnowsNeitherExclusiveRenamesNorLinks) {
  broken.renameError = EINVAL;
  broken.placeError = EINVAL;
  broken.linkError = EPERM;
  FileMover mover(to.path(), &broken);
  EXPECT_TRUE(mover.move(from.write("a.jpg", content), "a.jpg").moved);
  EXPECT_EQ(mover.move(from.write("a.jpg", "second"), "a.jpg").path, to / "a-2.jpg");
  EXPECT_EQ(to.read("a.jpg"), content);
  EXPECT_EQ(to.read("a-2.jpg"), "second");
  EXPECT_THAT(from.names(), IsEmpty());
}

TEST_F(FileMoverTest, ANameThatLeadsElsewhereIsPutIntoTheFolderAllTheSame) {
  FileMover mover(to.path());
  EXPECT_EQ(mover.move(from.write("1", "1"), "../../etc/x.jpg").path, to / "x.jpg");
  EXPECT_EQ(mover.move(from.write("2", "2"), "..").path, to / "Picture");
  EXPECT_EQ(mover.move(from.write("3", "3"), "").path, to / "Picture-2");
  EXPECT_EQ(mover.move(from.write("4", "4"), ".hidden").path, to / ".hidden");
}

TEST_F(FileMoverTest, AnythingButARegularFileIsRefusedAndLeftAlone) {
  FileMover mover(to.path());
  std::filesystem::create_symlink(from.write("target", content), from / "link.jpg");
  EXPECT_FALSE(mover.move(from / "link.jpg", "link.jpg").moved);
  EXPECT_FALSE(mover.move(from.path(), "folder.jpg").moved);
  EXPECT_FALSE(mover.move(from / "missing.jpg", "missing.jpg").moved);
  EXPECT_THAT(from.names(), ElementsAre("link.jpg", "target"));
  EXPECT_THAT(to.names(), IsEmpty());
}

TEST_F(FileMoverTest, BothFilesOfAPairGetABaseThatIsFreeForBoth) {
  to.write("Capture0001.jpg", "an older shot");
  to.write("Capture0001-2.tif", "another");
  FileMover mover(to.path());
  const auto raw = mover.move(from.write("r", "raw"), "Capture0001.nef", {}, true);
  EXPECT_EQ(raw.path, to / "Capture0001-3.nef");
  const auto jpeg = mover.move(from.write("j", "jpeg"), "Capture0001.jpg", {}, false, raw.base);
  EXPECT_EQ(jpeg.path, to / "Capture0001-3.jpg");
  const auto late = mover.move(from.write("l", "late"), "Capture0001.jpg", {}, false, raw.base);
  EXPECT_EQ(late.path, to / "Capture0001-3-2.jpg");
}

TEST_F(FileMoverTest, CopiesIntoAnotherFileSystem) {
  if (access("/dev/shm", W_OK) != 0) GTEST_SKIP() << "no second file system";
  const Folder other("/dev/shm");
  other.write("a.jpg", "old");
  FileMover mover(other.path());
  const auto moved = mover.move(from.write("a.jpg", content), "a.jpg");
  EXPECT_TRUE(moved.moved) << moved.description;
  EXPECT_EQ(other.read("a-2.jpg"), content);
  EXPECT_THAT(other.names(), ElementsAre("a-2.jpg", "a.jpg"));
  EXPECT_THAT(from.names(), IsEmpty());
}

TEST_F(FileMoverTest, FlushesTheBytesBeforeTheyHaveTheirNameAndTheFolderBeforeTheFirstCopyGoes) {
  broken.longestWrite = 1000;  // short writes are no failure
  const auto named = [&](const std::string& what) { return what + (to.names().back() == "a.jpg" ? " named" : ""); };
  std::vector<std::string> steps;
  broken.beforeFlush = [&](int descriptor) {
    struct stat status {};
    fstat(descriptor, &status);
    steps.push_back(named(S_ISDIR(status.st_mode) ? "folder" : "bytes"));
  };
  broken.beforeRemove = [&](const std::string&) { steps.push_back(named("remove")); };
  const std::vector<std::string> renamed{"bytes", "folder named"};
  const std::vector<std::string> copied{"bytes", "bytes", "folder named", "remove named"};
  const std::vector<std::string> linked{"bytes", "remove named", "folder named"};
  for (const auto& [error, expected] : {std::pair(0, renamed), std::pair(EXDEV, copied), std::pair(EINVAL, linked)}) {
    std::filesystem::remove(to / "a.jpg");
    to.write(".other", "");
    steps.clear();
    broken.renameError = error;
    FileMover mover(to.path(), &broken);
    EXPECT_TRUE(mover.move(from.write("a.jpg", content), "a.jpg").moved);
    EXPECT_EQ(steps, expected);
    EXPECT_EQ(to.read("a.jpg"), content);
  }
}

TEST_F(FileMoverTest, WhateverFailsLeavesTheFirstCopyAndNothingInTheFolder) {
  const std::string source = from.write("a.jpg", content);
  const auto failsWith = [&](const std::string& text, const std::string& folder) {
    FileMover mover(folder, &broken);
    const auto moved = mover.move(source, "a.jpg");
    EXPECT_FALSE(moved.moved);
    EXPECT_EQ(moved.path, source);
    EXPECT_THAT(moved.description, HasSubstr(text));
    EXPECT_EQ(from.read("a.jpg"), content);
    EXPECT_THAT(to.names(), IsEmpty());
    broken = Broken();
  };
  broken.room = 2'000'000;
  failsWith("No space left", to.path());
  for (const auto& [error, flushes] : {std::pair(0, 2), std::pair(EXDEV, 3), std::pair(EINVAL, 2)}) {
    for (int nth = 1; nth <= flushes; ++nth) {
      broken.renameError = error;
      broken.flushes = nth;
      failsWith("Input/output error", to.path());
    }
  }
  broken.placeError = EROFS;
  failsWith("Read-only file system", to.path());
  broken.renameError = EROFS;
  failsWith("Read-only file system", to.path());
  for (const int error : {0, EXDEV, EINVAL}) {
    broken.renameError = error;
    failsWith("No such file", to / "gone");
  }
}

TEST_F(FileMoverTest, ASaverTakesNothingButTheAnnouncedFileOfTheHelpersDirectoryAndKeepsTheOrder) {
  const auto directory = std::make_shared<const tether::PrivateDirectory>();
  const auto in = [&](const std::string& name) { return directory->path() + "/" + name; };
  for (const char* const name : {"a.nef", "a.jpg", "other.jpg"}) std::ofstream(in(name)) << "12345";
  const std::string outside = from.write("outside.jpg", "12345");
  std::filesystem::permissions(outside, std::filesystem::perms(0600));
  to.write("a.jpg", "older");
  const auto wakeup = std::make_shared<tether::Wakeup>();
  tether::FileSaver saver(to.path(), wakeup);
  saver.submit({1, directory, in("a.nef"), "a.nef", 5, 7});
  saver.submit({2, directory, outside, "b.jpg", 5});
  saver.submit({3, directory, in("../" + outside.substr(outside.rfind('/') + 1)), "b.jpg", 5});
  saver.submit({4, directory, in("other.jpg"), "b.jpg", 6});
  saver.submit({5, directory, in(".record"), "b.jpg", {}});
  saver.submit({6, directory, in("a.jpg"), "a.jpg", 5, 7});
  EXPECT_TRUE(saver.waitUntil(fake::soon()));
  EXPECT_TRUE(wakeup->takeNudge());
  EXPECT_EQ(saver.pending(), 6U);
  std::vector<std::uint64_t> moved;
  for (std::uint64_t ticket = 1; const auto saved = saver.next(); ++ticket) {
    EXPECT_EQ(saved->ticket, ticket);
    if (saved->file.moved) moved.push_back(ticket);
  }
  EXPECT_THAT(moved, ElementsAre(1U, 6U));
  EXPECT_THAT(to.names(), ElementsAre("a-2.jpg", "a-2.nef", "a.jpg"));
  EXPECT_EQ(std::filesystem::status(outside).permissions(), std::filesystem::perms(0600));
  EXPECT_THAT(directory->tidy(), ElementsAre(in("other.jpg")));
  std::filesystem::remove_all(directory->path());
}

}  // namespace
