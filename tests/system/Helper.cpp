#include "Helper.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>

#include "KtNSDataStreamBuf.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr auto kLimit = 60s;
constexpr auto kRepeat = 2s;
constexpr auto kPause = 5ms;  // between two looks at what cannot be waited for

std::uint32_t numberAt(const std::string& bytes, std::size_t offset) {
  std::uint32_t number = 0;
  for (unsigned i = 0; i < 4; ++i) number |= std::uint32_t{static_cast<std::uint8_t>(bytes.at(offset + i))} << (8 * i);
  return number;
}

Received decoded(std::string bytes, std::size_t place) {
  KtNSDataReadStreamBuf buffer(
      std::make_shared<const platform::Data>(std::vector<char>(bytes.begin() + 8, bytes.end())));
  std::istream in(&buffer);
  const std::unique_ptr<KtLuaTE> name(KtLuaTE::createFromStream(in));
  std::unique_ptr<KtLuaTE> data(KtLuaTE::createFromStream(in));
  if (!name || !data || buffer.available() != 0) throw std::runtime_error("a frame that is not whole");
  const auto id = static_cast<std::int32_t>(numberAt(bytes, 4));
  return {std::move(bytes), id, static_cast<std::string>(*name), std::move(data), Clock::now(), place};
}

KtLuaTE& valueOf(const Received& message, const char* key, std::int32_t kind) {
  KtLuaTE* const found = message.value(key);
  if (found == nullptr || found->getType() != kind) throw std::runtime_error(message.name + " without " + key);
  return *found;
}

std::size_t waiting(const Descriptor& pipe) {
  int count = 0;
  ioctl(pipe.get(), FIONREAD, &count);
  return static_cast<std::size_t>(count);
}

}  // namespace

KtLuaTE* Received::value(const char* key) const {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(data.get());
  return table == nullptr ? nullptr : table->elementForKey(key);
}

double Received::number(const char* key) const { return static_cast<double>(valueOf(*this, key, kKtLuaTypeNumber)); }

std::string Received::text(const char* key) const {
  return static_cast<std::string>(valueOf(*this, key, kKtLuaTypeString));
}

std::size_t Received::entries() const {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(data.get());
  return table == nullptr ? 0 : table->getEntries().size();
}

std::string littleEndian(std::uint32_t number) {
  std::string bytes;
  for (unsigned i = 0; i < sizeof number; ++i) bytes += static_cast<char>(number >> (8 * i) & 0xFF);
  return bytes;
}

std::string frame(std::int32_t id, const std::string& nameElement, const std::string& dataElement) {
  const auto length = static_cast<std::uint32_t>(sizeof id + nameElement.size() + dataElement.size());
  return littleEndian(length) + littleEndian(static_cast<std::uint32_t>(id)) + nameElement + dataElement;
}

std::string request(const char* name, std::int32_t id, std::optional<double> deviceId) {
  KtLuaTETable table;
  if (deviceId) table.Set("device_id", new KtLuaTENumber(*deviceId));
  return encodeFrame(id, name, deviceId ? &table : nullptr);
}

// The process.

Helper::Helper() {
  for (const auto& made : {helpers(), temporary(), cameras(), folder() / "drawer"}) fs::create_directories(made);
  setEnvironment("TMPDIR", temporary());
  setEnvironment("TETHER_VIRTUAL_CAMERAS", cameras());
  if (std::getenv("TSAN_OPTIONS") == nullptr)
    setEnvironment("TSAN_OPTIONS", "halt_on_error=1");  // a race is no good end
}

void Helper::install(const std::string& bundle, const std::string& library, const std::string& executable) const {
  const fs::path contents = helpers() / (bundle + ".bundle") / "Contents" / TETHER_BUNDLE_PLATFORM;
  fs::create_directories(contents);
  // A link would be the same library to the loader, however often it stands there.
  fs::copy_file(library, contents / (executable.empty() ? bundle : executable));
}

void Helper::start() {
  const fs::path executable = folder() / "TetherHelper.app/Contents" / TETHER_BUNDLE_PLATFORM / "TetherHelper";
  fs::create_directories(executable.parent_path());
  fs::copy_file(TETHER_HELPER, executable);
  std::signal(SIGPIPE, SIG_IGN);
  Pipe input = Pipe::make();
  Pipe output = Pipe::make();
  const Descriptor errors(open((folder() / "stderr").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600));
  std::vector<std::string> environment;
  for (const auto& [name, value] : _environment) environment.push_back(name + "=" + value);
  const fs::path script = folder() / "limited";
  std::ofstream(script) << "#!/bin/sh\n" << _limits << "exec '" << executable.string() << "'\n";
  fs::permissions(script, fs::perms::owner_all);
  _process = std::make_unique<HelperProcess>(HelperProcess::Start{
      _limits.empty() ? executable : script, environment, input.read.get(), output.write.get(), errors.get(), -1, {}});
  _input = std::move(input.write);
  _output = std::move(output.read);
  setNonBlocking(_input.get());
}

void Helper::send(const std::string& bytes) {
  const auto limit = Clock::now() + kLimit;
  for (std::size_t sent = 0; sent < bytes.size();) {
    const ssize_t count = write(_input.get(), bytes.data() + sent, bytes.size() - sent);
    if (count >= 0) {
      sent += static_cast<std::size_t>(count);
    } else if (errno == EAGAIN && Clock::now() < limit) {
      pollfd room{_input.get(), POLLOUT, 0};
      poll(&room, 1, 1000);
    } else if (errno != EINTR) {
      fail("the helper does not read");
    }
  }
}

void Helper::narrowOutput() const {
#ifdef F_SETPIPE_SZ
  fcntl(_output.get(), F_SETPIPE_SZ, 4096);
#endif
}

std::size_t Helper::unread() const { return waiting(_output); }

std::size_t Helper::unreadByHelper() const { return waiting(_input); }

int Helper::wait(Reading reading) {
  const auto limit = Clock::now() + kLimit;
  const bool reads = reading == Reading::yes && _output;
  while (reads && isRunning() && Clock::now() < limit) readUntil(Clock::now() + kPause);
  const auto status = _process->waitUntil(limit);
  if (!status) fail("the helper does not end");
  while (reads && readUntil(limit)) continue;
  if (!_received.empty()) fail("the helper's last frame is not whole");
  return WIFEXITED(*status) ? WEXITSTATUS(*status) : -WTERMSIG(*status);
}

void Helper::fail(const std::string& what) const {
  std::string text = what + "; messages so far:";
  for (const Received& message : _messages) text += " " + message.name;
  throw std::runtime_error(text);
}

// Messages.

bool Helper::readUntil(Clock::time_point limit) {
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(limit - Clock::now());
  pollfd ready{_output.get(), POLLIN, 0};
  if (poll(&ready, 1, static_cast<int>(std::max<std::int64_t>(left.count(), 0))) <= 0) return false;
  std::array<char, 65536> chunk{};
  const ssize_t count = read(_output.get(), chunk.data(), chunk.size());
  if (count <= 0) return false;
  _received.append(chunk.data(), static_cast<std::size_t>(count));
  while (_received.size() >= 4 && _received.size() - 4 >= numberAt(_received, 0)) {
    const std::size_t size = 4 + std::size_t{numberAt(_received, 0)};
    _messages.push_back(decoded(_received.substr(0, size), _messages.size()));
    _received.erase(0, size);
  }
  return true;
}

const Received* Helper::find(const Match& match, Clock::time_point limit) {
  for (std::size_t next = 0;;) {
    for (; next < _messages.size(); ++next) {
      Received& message = _messages[next];
      if (message.taken || !match(message)) continue;
      message.taken = true;
      return &message;
    }
    if (!readUntil(limit)) return nullptr;
  }
}

const Received& Helper::awaitMatch(const std::string& what, const Match& match) {
  const Received* const found = find(match, Clock::now() + kLimit);
  if (found == nullptr) fail("no " + what);
  return *found;
}

const Received& Helper::await(const std::string& name) {
  return awaitMatch(name, [&](const Received& message) { return message.name == name; });
}

const Received& Helper::awaitAnswer(std::int32_t id) {
  return awaitMatch("answer", [&](const Received& message) { return message.id == id; });
}

void Helper::settle() {
  // The request is dropped while a transfer goes on.
  const auto limit = Clock::now() + kLimit;
  const Received* answer = nullptr;
  while (answer == nullptr) {
    if (Clock::now() > limit) fail("no answer");
    send(request("getCameraSettings", ++_lastSettleId, kStudio));
    answer = find([&](const Received& message) { return message.id == _lastSettleId; }, Clock::now() + kRepeat);
  }
}

std::size_t Helper::count(const std::string& name) const {
  return static_cast<std::size_t>(
      std::count_if(_messages.begin(), _messages.end(), [&](const Received& message) { return message.name == name; }));
}

std::optional<Received> Helper::next(Clock::time_point limit) {
  while (_messages.empty() && readUntil(limit)) continue;
  if (_messages.empty()) return std::nullopt;
  Received message = std::move(_messages.front());
  _messages.pop_front();
  return message;
}

// Files.

void awaitCondition(const std::string& what, const std::function<bool()>& condition) {
  const auto limit = Clock::now() + kLimit;
  while (!condition()) {
    if (Clock::now() > limit) throw std::runtime_error("no " + what);
    std::this_thread::sleep_for(kPause);
  }
}

void drop(const fs::path& path, const std::string& bytes) {
  fs::create_directories(path.parent_path());
  const fs::path hidden = path.parent_path() / ("." + path.filename().string());
  std::ofstream(hidden, std::ios::binary) << bytes;
  fs::last_write_time(hidden, fs::file_time_type::clock::now() - 10s);
  fs::rename(hidden, path);
}

// The fixture.

void HelperTest::TearDown() {
  if (helper.isRunning()) {
    helper.closeInput();
    EXPECT_EQ(helper.wait(), 0);
  }
  if (HasFailure()) std::fprintf(stderr, "The helper's standard error:\n%s\n", helper.standardError().c_str());
}

void HelperTest::startWithCamera(const std::string& cameraFile) {
  helper.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
  fs::create_directories(studio());
  if (!cameraFile.empty()) drop(studio() / "camera.json", cameraFile);
  helper.start();
  const Received& added = helper.await("deviceAdded");
  EXPECT_EQ(added.number("device_id"), kStudio);
  EXPECT_EQ(added.text("name"), "Studio");
}

void HelperTest::connect(double deviceId) {
  helper.send(request("connectDevice", 1, deviceId));
  EXPECT_EQ(helper.awaitAnswer(1).name, "ok");
  helper.await("cameraSettingsChanged");
}

void HelperTest::plugIn(const std::string& camera) const {
  const fs::path drawer = helper.folder() / "drawer" / camera;
  fs::create_directories(drawer);
  fs::rename(drawer, helper.cameras() / camera);
}

void HelperTest::unplug(const std::string& camera) const {
  fs::rename(helper.cameras() / camera, helper.folder() / "drawer" / camera);
}

}  // namespace tether
