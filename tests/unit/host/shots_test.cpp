// The ledger of a run, step by step: each row is a story and what is known at its end.
#include "Shots.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sstream>

namespace {

using namespace std::chrono_literals;
using namespace tether::command;

// A story is made of these words:
//   s        a shutter is sent, if it may be: "wait" is told else; S in a series; F with a probe before it, which g
//            answers
//   p        a probe is sent and answered; q: it is dropped; h: a heartbeat comes
//   a1:x.jpg the picture with that capture id is announced; with a + behind it, as one of a pair; with 5000 behind a #,
//            with that size
//   c1 f1    it is complete, and saved; or cannot be saved. Told as name=shutter, with ? or 0 where there is none
//   +5       so many seconds pass; ++5: without anyone looking
//   u x      its camera is unplugged; the helper is gone
// The time-out is 10 seconds. Told last: saved/not saved/missing of the shutters, and of others.
class Story {
 public:
  std::string tell(const std::string& words) {
    std::istringstream stream(words);
    for (std::string word; stream >> word;) step(word);
    const auto& counts = shots.counts();
    for (const auto& tally : {counts.own, counts.others}) {
      told << tally.saved << "/" << tally.notSaved << "/" << tally.missing << " ";
    }
    std::string text = told.str();
    text.pop_back();
    return text;
  }

 private:
  void step(const std::string& word) {
    const std::string rest = word.substr(1);
    switch (word[0]) {
      case 's':
      case 'S':
        if (!shots.mayRelease(word[0] == 'S', now)) {
          told << "wait ";
          break;
        }
        shots.shutterSent({}, now);
        break;
      case 'F':
        shots.probeSent(++lastProbe, now);
        shots.shutterSent(lastProbe, now);
        break;
      case 'g':
        shots.answered(lastProbe, now);
        break;
      case 'q':
        shots.probeSent(++lastProbe, now);
        break;
      case 'p':
        shots.probeSent(++lastProbe, now);
        shots.answered(lastProbe, now);
        break;
      case 'a':
        announce(rest);
        break;
      case 'c':
      case 'f': {
        const Picture picture = shots.completed({std::stoi(rest), "/t/late.jpg"}, {}, now);
        told << picture.name << "=" << (picture.own == Own::kUnknown ? "?" : std::to_string(picture.shutter))
             << (picture.pair != 0 ? " of " + std::to_string(picture.pair) : "") << (picture.late ? " late " : " ");
        shots.ended(picture.number, word[0] == 'c');
        break;
      }
      case 'h':
        shots.heartbeat(now);
        break;
      case 'u':
        shots.unplugged("unplugged", now);
        break;
      case 'x':
        shots.giveUp("gone", now);
        break;
      default:
        pass(rest);
    }
    for (const Notice& notice : shots.takeNotices()) {
      told << "[" << notice.shutter << " " << notice.picture.name << ": " << notice.reason << "] ";
    }
  }

  void announce(const std::string& word) {
    tether::ObjectWasAdded object;
    object.capture_id = std::stoi(word);
    object.has_sidecar = word.back() == '+';
    object.file_name = word.substr(word.find(':') + 1);
    object.file_name = object.file_name.substr(0, object.file_name.find_first_of("+#"));
    if (word.find('#') != std::string::npos) object.file_size = std::stoi(word.substr(word.find('#') + 1));
    shots.announced(object, {}, now);
  }

  void pass(const std::string& seconds) {
    const bool blind = seconds[0] == '+';
    const auto until =
        now + std::chrono::milliseconds(static_cast<int>(1000 * std::stod(seconds.substr(blind ? 1 : 0))));
    if (blind) shots.delayed(until - now);
    for (; now < until; now = blind ? until : now + 100ms) shots.check(now);
    shots.check(now);
  }

  Shots shots{10s};
  Clock::time_point now{1h};
  std::int32_t lastProbe = 0;
  std::ostringstream told;
};

struct Row {
  const char* title;
  const char* story;
  const char* told;
};

const Row kTable[] = {
    {"a shutter's picture", "p p s p a1:A.jpg c1", "A.jpg=1 1/0/0 0/0/0"},
    {"a shutter without one, after its own time whatever comes meanwhile",
     "p p s p +3 S p a1:A.jpg c1 +8 p p a2:B.jpg c2",
     "A.jpg=2 [1 : no picture came within 10.0 s] B.jpg=0 1/0/1 1/0/0"},
    {"while another is transferred no time passes", "p p s p a1:A.jpg#900000 S h h +60 c1 +9 a2:B.jpg c2",
     "[1 A.jpg: ] A.jpg=1 B.jpg=2 2/0/0 0/0/0"},
    {"an exposure takes as long as it takes", "p p s +60 p +9 a1:A.jpg c1", "A.jpg=1 1/0/0 0/0/0"},
    {"shutters do not pile up", "p p s S p S p S +3 S p +3 S p +3 S p +3 S",
     "wait wait wait [1 : no picture came within 10.0 s] 0/0/1 0/0/0"},
    {"one at a time waits for all of the last one", "p p s p s a1:A.jpg s c1 s p s p s",
     "wait wait A.jpg=1 wait wait 1/0/0 0/0/0"},
    {"what comes before the shutter is another's", "p a1:O.jpg c1 s p p s p a2:A.jpg c2 p p +1 a3:P.jpg c3",
     "O.jpg=0 wait A.jpg=1 P.jpg=0 1/0/0 2/0/0"},
    {"also when it was on its way as the shutter was sent", "p p F a1:O.jpg c1 a2:A.jpg c2 p p F g a3:B.jpg c3",
     "O.jpg=0 A.jpg=1 B.jpg=2 2/0/0 1/0/0"},
    {"unless one waits that is overdue", "p p s p +3 p p F a1:A.jpg c1 a2:B.jpg c2", "A.jpg=1 B.jpg=2 2/0/0 0/0/0"},
    {"which of two is the shutter's cannot be known", "p p s p a1:A.jpg c1 a2:B.jpg c2", "A.jpg=1 B.jpg=? 1/0/0 1/0/0"},
    {"an answered probe proves that a transfer is over", "p p s p a1:A.jpg q +1 p +1",
     "[1 A.jpg: its transfer broke off] 0/0/1 0/0/0"},
    {"so does the next announcement", "p p s p a1:A.jpg S p a2:B.jpg c2",
     "[1 A.jpg: its transfer broke off, and the next picture's began] B.jpg=2 1/0/1 0/0/0"},
    {"a transfer that goes on is not given up, but a dead one is", "a1:A.jpg#100000 q +19 c1 a2:B.jpg#100000 +20 c2",
     "[0 A.jpg: ] A.jpg=0 [0 B.jpg: ] [0 B.jpg: its transfer has not ended after 20.0 s] B.jpg=0 late 0/0/0 2/0/0"},
    {"a pair is one, also when its first file was given up", "a1:A.nef+ +10 a2:A.jpg+ c2 c1",
     "[0 A.nef: its transfer has not ended after 10.0 s] A.jpg=0 of 1 A.nef=0 of 1 late 0/0/0 1/0/0"},
    {"pairs of two cameras with one name", "a1:A.nef+ c1 a2:A.nef+ c2 a3:A.jpg+ c3 a4:A.jpg+ c4",
     "A.nef=0 of 1 A.nef=0 of 2 A.jpg=0 of 1 A.jpg=0 of 2 0/0/0 2/0/0"},
    {"a partner that does not come, and comes", "a1:A.nef+ c1 +10 a2:A.jpg+ c2",
     "A.nef=0 of 1 [0 : the other file of A.nef did not come] A.jpg=0 of 1 late 0/0/0 1/0/0"},
    {"a picture that cannot be saved", "p p s p a1:A.jpg f1", "A.jpg=1 0/1/0 0/0/0"},
    {"unplugged: what is being received may still come, the rest will not", "p p s p a1:A.jpg S u +1 c1 p p",
     "A.jpg=1 [2 : unplugged] 1/0/1 0/0/0"},
    {"a helper that is gone takes along what was under way, and ids begin anew", "p p s p a1:A.jpg S x s p a1:B.jpg c1",
     "[1 A.jpg: gone] [2 : gone] B.jpg=3 1/0/2 0/0/0"},
    {"who could not look does not hold it against anyone", "p p s p ++60 +9 a1:A.jpg ++60 +9 c1",
     "A.jpg=1 1/0/0 0/0/0"},
    {"a completion without an announcement", "p p s p c7", "late.jpg=1 1/0/0 0/0/0"},
};

TEST(ShotsTest, EveryShutterAndEveryPictureIsAccountedFor) {
  for (const Row& row : kTable) EXPECT_EQ(Story().tell(row.story), row.told) << row.title;
}

}  // namespace
