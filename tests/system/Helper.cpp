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
#include <fstream>
#include <iterator>
#include <random>
#include <stdexcept>
#include <thread>

#include "KtNSDataStreamBuf.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr auto kLimit = 60s;
constexpr auto kRepeat = 2s;
constexpr auto kPause = 5ms;  // between two looks at what cannot be waited for

std::uint32_t readLittleEndian(const std::string& bytes, std::size_t offset) {
  std::uint32_t number = 0;
  for (std::size_t i = 0; i < sizeof number; ++i) {
    number |= std::uint32_t{static_cast<unsigned char>(bytes.at(offset + i))} << (8 * i);
  }
  return number;
}

Message decoded(const std::string& bytes) {
  Message message;
  message.bytes = bytes;
  message.id = static_cast<std::int32_t>(readLittleEndian(bytes, 4));
  const auto data = std::make_shared<const platform::Data>(std::vector<char>(bytes.begin() + 8, bytes.end()));
  KtNSDataReadStreamBuf buffer(data);
  std::istream in(&buffer);
  const std::unique_ptr<KtLuaTE> name(KtLuaTE::createFromStream(in));
  message.data.reset(KtLuaTE::createFromStream(in));
  if (!name || !message.data || buffer.available() != 0) throw std::runtime_error("a frame that is not whole");
  message.name = static_cast<std::string>(*name);
  message.arrived = Clock::now();
  return message;
}

KtLuaTE& valueOf(const Message& message, const char* key, std::int32_t kind) {
  KtLuaTE* const found = message.value(key);
  if (found == nullptr || found->getType() != kind) throw std::runtime_error(message.name + " without " + key);
  return *found;
}

std::size_t waiting(int pipe) {
  int count = 0;
  ioctl(pipe, FIONREAD, &count);
  return static_cast<std::size_t>(count);
}

void closeOnce(int& descriptor) {
  if (descriptor >= 0) close(descriptor);
  descriptor = -1;
}

}  // namespace

KtLuaTE* Message::value(const char* key) const {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(data.get());
  return table == nullptr ? nullptr : table->elementForKey(key);
}

double Message::number(const char* key) const { return static_cast<double>(valueOf(*this, key, kKtLuaTypeNumber)); }

std::string Message::text(const char* key) const {
  return static_cast<std::string>(valueOf(*this, key, kKtLuaTypeString));
}

bool Message::isNil(const char* key) const {
  const KtLuaTE* const found = value(key);
  return found != nullptr && found->getType() == kKtLuaTypeNil;
}

std::size_t Message::entries() const {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(data.get());
  return table == nullptr ? 0 : table->getEntries().size();
}

std::string littleEndian(std::uint32_t number) {
  std::string bytes;
  for (unsigned i = 0; i < sizeof number; ++i) bytes += static_cast<char>(number >> (8 * i) & 0xFF);
  return bytes;
}

std::string encoded(const KtLuaTE& element) {
  KtNSDataWriteStreamBuf buffer;
  std::ostream out(&buffer);
  element.writeToStream(out);
  const auto data = buffer.getNSData();
  return {data->bytes(), data->length()};
}

std::string frame(std::int32_t id, const std::string& nameElement, const std::string& dataElement) {
  const auto length = static_cast<std::uint32_t>(sizeof id + nameElement.size() + dataElement.size());
  return littleEndian(length) + littleEndian(static_cast<std::uint32_t>(id)) + nameElement + dataElement;
}

std::string request(const char* name, std::int32_t id) {
  return frame(id, encoded(KtLuaTEString(name)), encoded(KtLuaTENil()));
}

std::string request(const char* name, std::int32_t id, double deviceId) {
  KtLuaTETable table;
  table.Set("device_id", new KtLuaTENumber(deviceId));
  return frame(id, encoded(KtLuaTEString(name)), encoded(table));
}

// The process.

Helper::Helper() {
  std::string name = (fs::path(testing::TempDir()) / "tether-XXXXXX").string();
  if (mkdtemp(name.data()) == nullptr) throw std::runtime_error("no temporary folder");
  folder_ = fs::canonical(name);
  for (const auto& folder : {helpers(), temporary(), cameras(), folder_ / "drawer"}) fs::create_directories(folder);
  setEnvironment("TMPDIR", temporary().string());
  setEnvironment("TETHER_VIRTUAL_CAMERAS", cameras().string());
}

Helper::~Helper() {
  if (isRunning()) {
    kill(child_, SIGKILL);
    waitpid(child_, nullptr, 0);
  }
  closeInput();
  closeOutput();
  std::error_code ignored;
  fs::remove_all(folder_, ignored);
}

void Helper::install(const std::string& bundle, const std::string& library, const std::string& executable) {
  const fs::path contents = helpers() / (bundle + ".bundle") / "Contents" / TETHER_BUNDLE_PLATFORM;
  fs::create_directories(contents);
  // A link would be the same library to the loader, however often it stands there.
  fs::copy_file(library, contents / (executable.empty() ? bundle : executable));
}

fs::path Helper::executable() const {
  return folder_ / "TetherHelper.app/Contents" / TETHER_BUNDLE_PLATFORM / "TetherHelper";
}

void Helper::start() {
  fs::create_directories(executable().parent_path());
  fs::copy_file(TETHER_HELPER, executable());
  std::array<int, 2> input{};
  std::array<int, 2> output{};
  if (pipe(input.data()) != 0 || pipe(output.data()) != 0) throw std::runtime_error("no pipes");
  input_ = input[1];
  output_ = output[0];
  for (const int descriptor : {input_, output_}) fcntl(descriptor, F_SETFD, FD_CLOEXEC);
  fcntl(input_, F_SETFL, O_NONBLOCK);
  std::signal(SIGPIPE, SIG_IGN);
  child_ = fork();
  if (child_ == 0) runChild(input[0], output[1]);
  close(input[0]);
  close(output[1]);
  if (child_ < 0) throw std::runtime_error("no process");
}

// In the child, of a process with one thread.
void Helper::runChild(int input, int output) {
  dup2(input, STDIN_FILENO);
  dup2(output, STDOUT_FILENO);
  close(input);
  close(output);
  const int errors = open((folder_ / "stderr").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  dup2(errors, STDERR_FILENO);
  close(errors);
  for (const auto& [name, value] : environment_) setenv(name.c_str(), value.c_str(), 1);
  if (fileLimit_) {
    const rlimit limit{*fileLimit_, *fileLimit_};
    setrlimit(RLIMIT_FSIZE, &limit);
  }
  setenv("TSAN_OPTIONS", "halt_on_error=1", 0);  // a race is no good end
  for (const int number : {SIGPIPE, SIGXFSZ}) std::signal(number, SIG_DFL);
  execl(executable().c_str(), executable().c_str(), nullptr);
  _exit(127);
}

void Helper::send(const std::string& bytes) {
  const auto limit = Clock::now() + kLimit;
  for (std::size_t sent = 0; sent < bytes.size();) {
    const ssize_t count = write(input_, bytes.data() + sent, bytes.size() - sent);
    if (count >= 0) {
      sent += static_cast<std::size_t>(count);
    } else if (errno == EAGAIN && Clock::now() < limit) {
      pollfd room{input_, POLLOUT, 0};
      poll(&room, 1, 1000);
    } else if (errno != EINTR) {
      fail("the helper does not read");
    }
  }
}

void Helper::closeInput() { closeOnce(input_); }

void Helper::closeOutput() { closeOnce(output_); }

void Helper::narrowOutput() const {
#ifdef F_SETPIPE_SZ
  fcntl(output_, F_SETPIPE_SZ, 4096);
#endif
}

std::size_t Helper::unread() const { return waiting(output_); }

std::size_t Helper::unreadByHelper() const { return waiting(input_); }

int Helper::wait(Reading reading) {
  const auto limit = Clock::now() + kLimit;
  const bool reads = reading == Reading::yes && output_ >= 0;
  int status = 0;
  while (waitpid(child_, &status, WNOHANG) == 0) {
    if (Clock::now() > limit) fail("the helper does not end");
    if (!reads || !readUntil(Clock::now() + kPause)) std::this_thread::sleep_for(kPause);
  }
  child_ = 0;
  while (reads && readUntil(limit)) continue;
  if (!received_.empty()) fail("the helper's last frame is not whole");
  return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
}

std::string Helper::standardError() const { return readFile(folder_ / "stderr"); }

void Helper::fail(const std::string& what) const {
  std::string text = what + "; messages so far:";
  for (const Message& message : messages_) text += " " + message.name;
  throw std::runtime_error(text);
}

// Messages.

bool Helper::readUntil(Clock::time_point limit) {
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(limit - Clock::now());
  pollfd ready{output_, POLLIN, 0};
  if (poll(&ready, 1, static_cast<int>(std::max<std::int64_t>(left.count(), 0))) <= 0) return false;
  std::array<char, 65536> chunk{};
  const ssize_t count = read(output_, chunk.data(), chunk.size());
  if (count <= 0) return false;
  received_.append(chunk.data(), static_cast<std::size_t>(count));
  cutFrames();
  return true;
}

void Helper::cutFrames() {
  while (received_.size() >= 4 && received_.size() - 4 >= readLittleEndian(received_, 0)) {
    const std::size_t size = 4 + std::size_t{readLittleEndian(received_, 0)};
    Message message = decoded(received_.substr(0, size));
    message.place = messages_.size();
    messages_.push_back(std::move(message));
    received_.erase(0, size);
  }
}

const Message* Helper::find(const Match& match, Clock::time_point limit) {
  for (std::size_t next = 0;;) {
    for (; next < messages_.size(); ++next) {
      Message& message = messages_[next];
      if (message.taken || !match(message)) continue;
      message.taken = true;
      return &message;
    }
    if (!readUntil(limit)) return nullptr;
  }
}

const Message& Helper::awaitMatch(const std::string& what, const Match& match) {
  const Message* const found = find(match, Clock::now() + kLimit);
  if (found == nullptr) fail("no " + what);
  return *found;
}

const Message& Helper::await(const std::string& name) {
  return awaitMatch(name, [&](const Message& message) { return message.name == name; });
}

const Message& Helper::awaitAnswer(std::int32_t id) {
  return awaitMatch("answer", [&](const Message& message) { return message.id == id; });
}

void Helper::settle() {
  // The request is dropped while a transfer goes on.
  const auto limit = Clock::now() + kLimit;
  const Message* answer = nullptr;
  while (answer == nullptr) {
    if (Clock::now() > limit) fail("no answer");
    send(request("getCameraSettings", ++lastSettleId_, kStudio));
    answer = find([&](const Message& message) { return message.id == lastSettleId_; }, Clock::now() + kRepeat);
  }
}

std::size_t Helper::count(const std::string& name) const {
  return static_cast<std::size_t>(
      std::count_if(messages_.begin(), messages_.end(), [&](const Message& message) { return message.name == name; }));
}

std::optional<Message> Helper::next(Clock::time_point limit) {
  while (messages_.empty() && readUntil(limit)) continue;
  if (messages_.empty()) return std::nullopt;
  Message message = std::move(messages_.front());
  messages_.pop_front();
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

std::string pattern(std::size_t size, unsigned seed) {
  std::minstd_rand random(seed);
  std::string bytes(size, '\0');
  for (char& byte : bytes) byte = static_cast<char>(random() >> 8);
  return bytes;
}

std::string readFile(const fs::path& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
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
  const Message& added = helper.await("deviceAdded");
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
