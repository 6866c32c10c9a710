// What is killed costs no picture.
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <map>

#include "Fake.h"
#include "FileSaver.h"

namespace {

using fake::Folder;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using tether::Leftover;

// The process ends before or behind the nth call. Renaming fails with an error, but within the folder for EXDEV.
class Killed : public tether::FileCalls {
  template <typename Call>
  auto call(const Call& make) {
    --_left;
    if (_left == 0 && !_behind) _exit(1);
    const auto result = make();
    if (_left == 0) _exit(1);
    return result;
  }

 public:
  Killed(int error, int nth, bool behind) : _error(error), _left(nth), _behind(behind) {}
  int renameExclusively(const std::string& from, const std::string& to) override {
    const bool fails = _error != 0 && (_error != EXDEV || from.find("/.") == std::string::npos);
    return call([&] { return fails ? _error : FileCalls::renameExclusively(from, to); });
  }
  int link(const std::string& from, const std::string& to) override {
    return call([&] { return FileCalls::link(from, to); });
  }
  ssize_t write(int descriptor, const void* bytes, std::size_t count) override {
    return call([&] { return FileCalls::write(descriptor, bytes, std::min<std::size_t>(count, 7000)); });
  }
  int flush(int /*descriptor*/) override {
    return call([] { return 0; });
  }
  int remove(const std::string& path) override {
    return call([&] { return FileCalls::remove(path); });
  }

 private:
  const int _error;
  int _left;
  const bool _behind;
};

// One picture in a private directory of a process that is killed by `work`; whoever comes next finds it.
class LeftoverTest : public testing::Test {
 protected:
  LeftoverTest() { setenv("TMPDIR", temporary.path().c_str(), 1); }
  ~LeftoverTest() override { unsetenv("TMPDIR"); }

  // In a process that ends without a destructor.
  template <typename Work>
  int killed(const Work& work) {
    const pid_t child = fork();
    if (child == 0) {
      const auto directory = std::make_shared<tether::PrivateDirectory>(to.path());
      work(directory);
      _exit(0);
    }
    int status = 0;
    waitpid(child, &status, 0);
    return WEXITSTATUS(status);
  }
  // What becomes of each file, by its name.
  std::map<std::string, Leftover::Fate> collect() {
    tether::FileSaver saver(elsewhere.path(), nullptr);
    saver.collectLeftovers();
    saver.waitUntil(fake::soon());
    std::map<std::string, Leftover::Fate> fates;
    while (const auto found = saver.nextLeftover()) {
      fates[std::filesystem::path(found->found).filename()] = found->fate;
      descriptions += found->file.description + "\n";
    }
    return fates;
  }

  Folder temporary;
  Folder to;
  Folder elsewhere;
  std::string descriptions;
};

TEST_F(LeftoverTest, APictureWhoseMoveWasKilledAtAnyCallIsWholeHereOrThereAndOnceWhenTheNextProcessIsDone) {
  const std::string content = std::string(20'000, 'x') + "end";
  for (const auto& [error, calls] : {std::pair(0, 3), std::pair(EXDEV, 10), std::pair(EINVAL, 5)}) {
    for (int kill = 2; kill <= 2 * calls + 2; ++kill) {
      to.write("a.jpg", "old");
      killed([&, error = error](const auto& directory) {
        Killed calling(error, kill / 2, kill % 2 == 1);
        std::ofstream(directory->path() + "/a.jpg") << content;
        tether::FileSaver saver(to.path(), nullptr, &calling);
        saver.submit({1, directory, directory->path() + "/a.jpg", "a.jpg", 20'003});
        saver.waitUntil(fake::soon());
      });
      SCOPED_TRACE("error " + std::to_string(error) + ", kill " + std::to_string(kill));
      EXPECT_TRUE(to.read("a-2.jpg") == content || !std::filesystem::exists(to / "a-2.jpg"));
      collect();
      EXPECT_THAT(to.names(), ElementsAre("a-2.jpg", "a.jpg"));
      EXPECT_EQ(to.read("a-2.jpg"), content);
      EXPECT_EQ(to.read("a.jpg"), "old");
      EXPECT_THAT(temporary.names(), IsEmpty());
      std::filesystem::remove(to / "a-2.jpg");
    }
  }
}

TEST_F(LeftoverTest, WhatWasWholeIsBroughtToItsFolderAndTheRestRemovedAndWhatIsNeitherStays) {
  const tether::PrivateDirectory living;
  std::ofstream(living.path() + "/living.jpg") << "12345";
  to.write("pair.jpg", "older");
  killed([](const auto& directory) {
    const auto add = [&](int id, const std::string& name, int announced, int size, bool complete = false) {
      directory->noteAnnounced({id, name.starts_with("pair"), name, announced});
      std::ofstream(directory->path() + "/" + name) << std::string(static_cast<std::size_t>(size), 'x');
      if (complete) directory->noteComplete({id, directory->path() + "/" + name});
    };
    add(1, "complete.jpg", 5, 5, true);
    add(2, "whole.jpg", 5, 5);
    add(3, "cut.jpg", 5, 4);
    add(4, "empty.jpg", 5, 0);
    add(5, "lying.jpg", 5, 6, true);
    add(6, "pair.nef", 5, 5, true);
    add(7, "pair.jpg", 6, 6, true);
    std::ofstream(directory->path() + "/unknown.jpg") << "12345";
    std::filesystem::create_symlink("/etc/passwd", directory->path() + "/link.jpg");
    dup2(directory->descriptor(), 9);  // of a helper that takes its time to end
    std::system(("(sleep 0.2; printf 12345 >'" + directory->path() + "/late.jpg') &").c_str());
  });
  using Fate = Leftover::Fate;
  const std::map<std::string, Fate> expected{{"complete.jpg", Fate::kSaved}, {"whole.jpg", Fate::kSaved},
                                             {"cut.jpg", Fate::kRemoved},    {"empty.jpg", Fate::kRemoved},
                                             {"lying.jpg", Fate::kLeft},     {"pair.nef", Fate::kSaved},
                                             {"pair.jpg", Fate::kSaved},     {"link.jpg", Fate::kLeft},
                                             {"late.jpg", Fate::kSaved},     {"unknown.jpg", Fate::kSaved}};
  EXPECT_EQ(collect(), expected);
  EXPECT_THAT(descriptions, HasSubstr("6 bytes, not the 5 announced"));
  EXPECT_THAT(to.names(), ElementsAre("complete.jpg", "late.jpg", "pair-2.jpg", "pair-2.nef", "pair.jpg", "unknown.jpg",
                                      "whole.jpg"));
  EXPECT_THAT(elsewhere.names(), IsEmpty());
  EXPECT_TRUE(std::filesystem::exists(living.path() + "/living.jpg"));
  EXPECT_THAT(collect(), IsEmpty());  // what stays has been told of
}

}  // namespace
