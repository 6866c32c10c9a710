// Pictures through the whole helper, beside filling a buffer and writing it.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <thread>

#include "HelperProcess.h"
#include "Measure.h"
#include "MemoryBlock.h"
#include "Suites.h"
#include "VirtualCamera.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kMiB = std::size_t{1} << 20;
constexpr std::size_t kPiece = kMiB;  // what the camera delivers at a time
constexpr double kRoomBeside = 4.0 * kMiB;
constexpr std::chrono::seconds kRest{6};

double since(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

// A helper with one camera, which shoots when it is told to.
class Studio {
 public:
  Studio(std::size_t bytes, int pictures = 0) {
    const std::string pipe = _folder.path() + "/shutter";
    if (mkfifo(pipe.c_str(), 0600) != 0) throw std::runtime_error("no named pipe");
    _shutter = open(pipe.c_str(), O_RDWR | O_CLOEXEC);
    const std::string held = std::to_string(pictures) + " " + std::to_string(bytes);
    _helper.emplace(BENCH_HELPER_WITH_PICTURES, std::vector{"TMPDIR=" + _folder.path(), "TETHER_BENCH_SHUTTER=" + pipe,
                                                            "TETHER_BENCH_PICTURES=" + held});
    _helper->await("deviceAdded");
  }
  Studio(const Studio&) = delete;
  Studio& operator=(const Studio&) = delete;
  ~Studio() { close(_shutter); }

  void shoot() const {
    if (write(_shutter, "!", 1) != 1) throw std::runtime_error("the shutter is stuck");
  }
  // From the first delivery of the first picture to the end of the last one.
  double receive(int pictures) {
    _helper->await("objectWasAdded");
    const auto start = Clock::now();
    for (int number = 0; number < pictures; ++number) _helper->await("fileDownloadComplete");
    return since(start);
  }
  void clear() const {
    for (const auto& entry : std::filesystem::directory_iterator(_folder.path())) {
      if (entry.is_regular_file()) std::filesystem::remove(entry);
    }
  }
  double memory() const { return _helper->memory(); }
  double peakMemory() const { return _helper->peakMemory(); }

 private:
  TemporaryFolder _folder;
  int _shutter = -1;
  std::optional<HelperProcess> _helper;
};

void writeFile(const std::string& path, const char* bytes, std::size_t size) {
  const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  bool whole = file >= 0;
  for (std::size_t done = 0; whole && done < size;) {
    const ssize_t written = write(file, bytes + done, size - done);
    whole = written > 0;
    done += whole ? static_cast<std::size_t>(written) : 0;
  }
  if (!whole || close(file) != 0) throw std::runtime_error("a picture could not be written");
}

using Block = std::unique_ptr<char, void (*)(void*)>;

Block filledBlock(std::size_t bytes) {
  static const std::vector<char> piece(kPiece, 'x');
  Block block(static_cast<char*>(std::malloc(bytes)), std::free);
  if (!block) throw std::runtime_error("no memory for a picture");
  for (std::size_t done = 0; done < bytes; done += kPiece) {
    std::memcpy(block.get() + done, piece.data(), std::min(bytes - done, kPiece));
  }
  return block;
}

// A virtual machine's memory may have to be fetched from its host first, which takes many times as long as to fill it.
// A block and files that come and go before every turn leave enough of it at hand for either side.
void fetchMemory(std::size_t bytes) {
  const TemporaryFolder folder;
  const platform::MemoryBlock block(bytes);
  std::memset(block.data(), 'x', bytes);
  for (int number = 0; number < 2; ++number) {
    writeFile(folder.path() + "/" + std::to_string(number), block.data(), bytes);
  }
}

double timeOf(const std::function<void(const std::string& path)>& work) {
  const TemporaryFolder folder;
  const auto start = Clock::now();
  work(folder.path() + "/picture");
  return since(start);
}

void measureOne(Report& report, std::size_t size, int turns) {
  std::vector<double> first;
  std::vector<double> later;
  std::vector<double> filledAndWritten;
  std::vector<double> written;
  std::vector<double> peak;
  Studio series(size);
  const double before = series.memory();
  series.shoot();
  series.receive(1);
  series.clear();
  const Block filled = filledBlock(size);
  const std::vector<std::function<void()>> sides{
      [&] {
        Studio fresh(size);
        fetchMemory(size);
        fresh.shoot();
        first.push_back(fresh.receive(1));
        peak.push_back(fresh.peakMemory());
      },
      [&] {
        series.shoot();
        later.push_back(series.receive(1));
        series.clear();
      },
      [&] {
        filledAndWritten.push_back(
            timeOf([&](const std::string& path) { writeFile(path, filledBlock(size).get(), size); }));
      },
      [&] { written.push_back(timeOf([&](const std::string& path) { writeFile(path, filled.get(), size); })); }};
  for (int turn = 0; turn < turns; ++turn) {
    // Who goes first changes: what one leaves behind would always meet the same other.
    for (std::size_t side = 0; side < sides.size(); ++side) {
      fetchMemory(size);
      sides[(side + static_cast<std::size_t>(turn)) % sides.size()]();
    }
  }
  const std::string name = "picture of " + std::to_string(size / kMiB) + " MiB, ";
  report.add({name + "a helper's first / fill and write", median(first), median(filledAndWritten), Unit::seconds, 1.5});
  report.add({name + "in a series / fill and write", median(later), median(filledAndWritten), Unit::seconds, 1.5});
  report.add({name + "in a series / one plain write", median(later), median(written), Unit::seconds, 1.3});
  // The module has a piece of the picture, which is not the helper's.
  report.add({name + "peak memory / size + 4 MiB", median(peak) - static_cast<double>(kPiece),
              static_cast<double>(size) + kRoomBeside, Unit::bytes, 1.0});
  std::this_thread::sleep_for(kRest);
  report.add({name + "memory after a rest / before the first one + 4 MiB", series.memory(), before + kRoomBeside,
              Unit::bytes, 1.0});
}

// The same pictures with nothing but the camera module and the writes: every call that a transfer needs, and the pause
// behind every poll.
class BareTransfer {
 public:
  BareTransfer(int count, std::size_t bytes) : _camera(_model.addCamera(1, "Pattern")), _buffer(bytes) {
    for (int number = 0; number < count; ++number) {
      _camera.shoot(virtualcamera::Picture::jpeg(std::vector<std::uint8_t>(bytes, 'x')));
    }
    open(nullptr, 0, _module);
    open(&_module, 1, _open);
  }

  void run(const std::string& folder) {
    for (const std::uint32_t item : _camera.items()) {
      tagNkMAIDObject container{};
      tagNkMAIDObject data{};
      open(&_open, item, container);
      open(&container, kNkMAIDDataObjType_Image, data);
      tagNkMAIDCallback receiver{reinterpret_cast<void (*)()>(&onData), this};
      call(&data, kNkMAIDCommand_CapSet, kNkMAIDCapability_DataProc, kNkMAIDDataType_CallbackPtr, &receiver);
      _complete = false;
      virtualcamera::entryPoint(&data, kNkMAIDCommand_CapStart, kNkMAIDCapability_Acquire, kNkMAIDDataType_Null, 0,
                                onCompletion, this);
      while (!_complete) {
        call(&data, kNkMAIDCommand_Async, 0, kNkMAIDDataType_Null, nullptr);
        nanosleep(&kPause, nullptr);
      }
      writeFile(folder + "/" + std::to_string(item), _buffer.data(), _buffer.size());
      call(&data, kNkMAIDCommand_Close, 0, kNkMAIDDataType_Null, nullptr);
      call(&container, kNkMAIDCommand_Close, 0, kNkMAIDDataType_Null, nullptr);
    }
  }

 private:
  static constexpr timespec kPause{0, 10'000};

  static void call(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType,
                   void* data) {
    const std::int32_t result = virtualcamera::entryPoint(object, command, parameter, dataType,
                                                          reinterpret_cast<std::uint64_t>(data), nullptr, nullptr);
    if (result < kNkMAIDResult_NoError) throw std::runtime_error("the camera module refuses");
  }
  static void open(tagNkMAIDObject* parent, std::uint32_t id, tagNkMAIDObject& object) {
    call(parent, kNkMAIDCommand_Open, id, kNkMAIDDataType_ObjectPtr, &object);
  }
  static std::int32_t onData(void* self, void* record, void* bytes) {
    const auto& info = *static_cast<const tagNkMAIDFileInfo*>(record);
    std::memcpy(static_cast<BareTransfer*>(self)->_buffer.data() + info.ulStart, bytes, info.ulLength);
    return 0;
  }
  static void onCompletion(tagNkMAIDObject*, std::uint32_t, std::uint32_t, std::uint32_t, std::uint64_t, void* self,
                           std::int32_t) {
    static_cast<BareTransfer*>(self)->_complete = true;
  }

  virtualcamera::Model _model;
  virtualcamera::Camera& _camera;
  std::vector<char> _buffer;
  tagNkMAIDObject _module{};
  tagNkMAIDObject _open{};
  bool _complete = false;
};

// The time of the last and largest number of them, and how much longer it takes for twice as many.
void measureMany(Report& report, std::size_t bytes, int turns) {
  std::map<int, std::vector<double>> ours;
  std::vector<double> bare;
  // Many removed files slow a file system down that is asked for new ones soon after: they stay until the end.
  std::vector<std::unique_ptr<Studio>> studios;
  std::vector<std::unique_ptr<TemporaryFolder>> folders;
  for (int turn = 0; turn < turns; ++turn) {
    for (const int count : {500, 1000}) {
      studios.push_back(std::make_unique<Studio>(bytes, count));
      ours[count].push_back(studios.back()->receive(count));
    }
    BareTransfer transfer(1000, bytes);
    const TemporaryFolder& folder = *folders.emplace_back(std::make_unique<TemporaryFolder>());
    const auto start = Clock::now();
    transfer.run(folder.path());
    bare.push_back(since(start));
  }
  report.add({"1,000 queued pictures of 64 KiB / the module and the writes alone", median(ours[1000]), median(bare),
              Unit::seconds, 1.5});
  report.add({"1,000 queued pictures / twice 500", median(ours[1000]), 2 * median(ours[500]), Unit::seconds, 1.2});
}

}  // namespace

void measurePictures(Report& report) {
  for (const std::size_t size : {12, 64, 120, 512}) measureOne(report, size * kMiB, size > 100 ? 5 : 9);
  measureMany(report, 64 * 1024, 5);
}
