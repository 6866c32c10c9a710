#include "Console.h"

#include <poll.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <string_view>

namespace tether::command {
namespace {

using namespace std::chrono_literals;

// How long output is waited for that nobody may read any more.
constexpr auto kMoment = 500ms;
constexpr std::size_t kUsualWidth = 80;

bool isLiveTerminal() {
  const char* const kind = std::getenv("TERM");
  return isatty(STDERR_FILENO) == 1 && kind != nullptr && std::string_view(kind) != "dumb";
}

// At most so many characters of UTF-8 text.
std::string cut(const std::string& text, std::size_t width) {
  std::size_t characters = 0;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const bool begins = (static_cast<unsigned char>(text[i]) & 0xc0U) != 0x80U;
    if (begins && ++characters > width) return text.substr(0, i);
  }
  return text;
}

}  // namespace

Console::Console(bool json, Wakeup& wakeup) : _json(json), _live(isLiveTerminal()), _wakeup(wakeup) {}

Console::~Console() { status(""); }

void Console::result(const std::string& text, const Json& object) {
  if (_json) {
    writeLine(object.dump(-1, ' ', false, Json::error_handler_t::replace));
  } else if (!text.empty()) {
    writeLine(printable(text));
  }
}

void Console::writeLine(std::string line) {
  const platform::Guard guard(_lock);
  replaceStatus("");
  line += '\n';
  if (_closed || writeAll(STDOUT_FILENO, line)) return;
  _closed = true;
  // A reader that has seen enough is no fault, nor one that is not waited for.
  if (errno == EPIPE || errno == ECANCELED) return;
  writeAll(STDERR_FILENO, std::string("tether: cannot write to standard output: ") + std::strerror(errno) + "\n");
}

void Console::say(const std::string& text) {
  const platform::Guard guard(_lock);
  replaceStatus("");
  writeAll(STDERR_FILENO, "tether: " + printable(text) + "\n");
}

void Console::status(const std::string& text) {
  const platform::Guard guard(_lock);
  replaceStatus(text);
}

void Console::replaceStatus(const std::string& text) {
  if (!_live || text == _shown) return;
  winsize size{};
  const bool known = ioctl(STDERR_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 1;
  writeAll(STDERR_FILENO, "\r\033[K" + cut(printable(text), known ? size.ws_col - 1U : kUsualWidth - 1));
  _shown = text;
}

bool Console::writeAll(int descriptor, std::string_view text) {
  while (!text.empty()) {
    if (!waitFor(descriptor)) {
      errno = ECANCELED;
      return false;
    }
    // A pipe that is ready takes so much without a wait.
    const ssize_t written = write(descriptor, text.data(), std::min<std::size_t>(text.size(), PIPE_BUF));
    if (written < 0 && errno != EINTR && errno != EAGAIN && errno != EWOULDBLOCK) return false;
    if (written > 0) text.remove_prefix(static_cast<std::size_t>(written));
  }
  return true;
}

bool Console::waitFor(int descriptor) {
  const bool patient = !_wakeup.everInterrupted();
  if (std::this_thread::get_id() == _thread) {
    return _wakeup.waitUntilWritable(descriptor, patient ? Clock::time_point::max() : Clock::now() + kMoment);
  }
  pollfd ready{descriptor, POLLOUT, 0};
  return poll(&ready, 1, static_cast<int>(std::chrono::milliseconds(kMoment).count())) > 0;
}

}  // namespace tether::command
