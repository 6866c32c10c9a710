// What a host must have seen of a helper whose virtual cameras the same program drives: cameras, pictures, answers.
// Everything here throws std::runtime_error on the first message or file that must not be. One thread.
#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "Helper.h"

namespace tether {

enum class Fate { whole, begun, unseen };  // announced and complete; only announced; neither

struct Picture {
  std::string file{};  // below its camera's folder
  std::size_t size = 0;
  unsigned seed = 0;
  bool sidecar = false;
  Fate fate = Fate::whole;
  bool opens = true;
  bool knownPair = true;                       // its data object opens at once, and tells
  std::pair<std::size_t, std::size_t> hole{};  // bytes that no delivery brings
  bool sent = false;                           // the camera has sent all of it, although it does not arrive whole
  int downloadId = 0;
  std::string fault{};  // as camera.json has it
};
using Pictures = std::map<std::string, Picture>;  // by file

struct Camera {
  double device = 0;
  std::string folder{};
  bool plugged = false;
  bool seen = false;   // the host was told
  bool known = false;  // the helper has seen it before: what came since is not on its card
  int battery = 0;
  Pictures held{};  // what its folder has
  // Since it was plugged in.
  unsigned items = 0;
  int downloadId = 1;
  bool pairPending = false;
  std::deque<Picture> due{};

  void expect(Picture picture);
};

struct Figures {
  unsigned pictures = 0, pairs = 0, plugs = 0, requests = 0, failures = 0;
  std::uint64_t bytes = 0;
};

class Model {
 public:
  explicit Model(const Helper& helper);

  void see(const Message& message);
  // The request's bytes. In a busy helper settings may be asked for in vain, or may be those of before.
  std::string ask(const std::string& name, double device, bool busy);
  bool nothingDue() const;
  std::string whatIsDue() const;
  // Once the helper has let a removed camera go.
  void forget(Camera& camera);
  // Nothing may stay in the folder but empty files of pictures that were only announced. They are removed.
  void checkFolder();
  std::filesystem::path folderOf(const Camera& camera) const;

  std::vector<Camera> cameras{};
  Camera* connected = nullptr;
  Figures figures{};
  unsigned announced = 0;
  std::int32_t lastAsked = 0;
  std::int32_t lastAnswered = 0;

 private:
  struct Answer {
    std::string name{};  // empty: there must be none
    std::string text{};
    std::optional<int> battery{};
    bool must = true;
  };
  Answer expected(const std::string& name, double device);
  void answered(const Message& message);
  void comesOrGoes(const Message& message, bool comes);
  void begins(const Message& message);
  bool takeDue(Camera& camera, std::size_t size);
  void completes(const Message& message);
  void disconnect();

  const Helper& helper_;
  std::map<std::int32_t, Answer> awaited_{};
  bool everConnected_ = false;
  bool settingsOwed_ = false;           // to whom is connected now
  int settingsAllowed_ = 0;             // one for each connection
  std::map<int, std::string> names_{};  // base names, by download id
  std::set<std::string> left_{};        // names of pictures that were only announced
  Camera* source_ = nullptr;            // of the picture that is being received
  Picture current_{};
  std::string currentName_{};
};

void require(bool met, const std::string& what);

}  // namespace tether
