// What is said of pictures and cameras, in words and in JSON. docs/json.md has an example of each object.
#pragma once

#include <string>

#include "Console.h"
#include "FileMover.h"
#include "Shots.h"

namespace tether::command {

// For the last line of a run.
Json countsJson(const Shots::Counts& counts);

class Report {
 public:
  // `folder`: where pictures go. `namesOthers`: whether pictures of others are named as such. The console outlives the
  // report.
  Report(Console& console, std::string folder, bool namesOthers)
      : _console(console), _folder(std::move(folder)), _namesOthers(namesOthers) {}

  // `text`: for people; "" for nothing.
  void camera(const char* event, const Camera& camera, const std::string& text);
  void connectFailed(const Camera& camera, const std::string& reason, bool silently);
  void helperLost(const std::string& reason);
  // A line of the helper's log. Silently: it is seen already.
  void helperLog(const std::string& text, bool silently);
  void shutter(int number);
  void receiving(const Picture& picture);
  void saved(const Picture& picture, const MovedFile& file);
  void notSaved(const Picture& picture, const MovedFile& file);
  // `cause`: what else is known of the reason, or "".
  void notice(const Notice& notice, const std::string& cause);
  // What became of a file that was `found` somewhere: in the directory of a helper that has ended, or left by a tether
  // that was killed.
  static void leftover(Console& console, const char* fate, const std::string& found, const std::string& path,
                       const std::string& remark);
  // A picture that is known by the helper's log alone.
  void neverCame(const std::string& reason);

 private:
  Console& _console;
  std::string _folder;
  bool _namesOthers;
};

}  // namespace tether::command
