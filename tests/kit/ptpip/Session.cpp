// What the camera says on its connections.
#include <chrono>

#include "Camera.h"

namespace ptpip {
namespace {

using Clock = std::chrono::steady_clock;
using Guard = platform::Guard<platform::Mutex>;

constexpr std::uint32_t kStorage = 0x00010001;
constexpr std::uint64_t kThumbnail = 5000;

struct Request {
  std::uint16_t operation = 0;
  std::uint32_t transaction = 0;
  std::uint32_t parameters[3]{};
  std::string data{};
};

struct Answer {
  std::uint16_t code = kGood;
  std::vector<std::uint32_t> parameters{};
  bool withData = false;
  std::string data{};
  std::optional<Picture> picture{};  // then the data are its bytes from `first`
  std::uint64_t first = 0;
  std::uint64_t size = 0;

  Answer(std::uint16_t response) : code(response) {}
  Answer(std::uint16_t response, std::uint64_t number)
      : code(response), parameters{static_cast<std::uint32_t>(number)} {}
  Answer(const Writer& dataset) : withData(true), data(dataset.bytes()), size(data.size()) {}
  Answer(const Picture& source, std::uint64_t from, std::uint64_t most)
      : withData(true), picture(source), first(std::min(from, source.size)) {
    size = std::min(most, source.size - first);
    parameters = {static_cast<std::uint32_t>(size)};
  }
  std::string bytes(std::uint64_t at, std::uint64_t length) const {
    std::string result = picture ? picture->bytes(first + at, length) : data.substr(std::min(at, data.size()), length);
    result.resize(length);
    return result;
  }
};

Answer deviceInfo(const Camera& camera) {
  std::vector<std::uint16_t> properties;
  for (const auto& [code, property] : camera.properties) properties.push_back(code);
  Writer writer;
  writer.number(2, 100).number(4, 0).number(2, 0).text("").number(2, 0).array(2, camera.operations);
  writer.array(2, std::vector<int>{kAdded, kRemoved, kPropertyChanged, kCaptureComplete});
  writer.array(2, properties).array(2, std::vector{0x3801}).array(2, std::vector{0x3801, 0x3000, 0x300D, 0x3001});
  return writer.text("Test").text(camera.model).text("1.0").text(camera.serial);
}

Answer storageInfo(const Camera& camera) {
  Writer writer;
  writer.number(2, 4).number(2, 3).number(2, 0).number(8, 128'000'000'000).number(8, camera.free);
  return writer.number(4, camera.free / std::max<std::uint64_t>(camera.sizes[0], 1)).text("Card").text("CARD");
}

Answer objectInfo(std::uint32_t handle, const Object& object) {
  const bool jpeg = object.format() == 0x3801;
  char date[24];
  std::snprintf(date, sizeof date, "20260101T%02u%02u%02u", handle / 3600 % 24, handle / 60 % 60, handle % 60);
  Writer writer;
  writer.number(4, kStorage).number(2, object.format()).number(2, 0).number(4, object.picture.size);
  writer.number(2, object.isFolder() ? 0 : 0x3801).number(4, kThumbnail).number(4, 160).number(4, 120);
  writer.number(4, jpeg ? 6000 : 0).number(4, jpeg ? 4000 : 0).number(4, jpeg ? 8 : 0).number(4, object.parent);
  writer.number(2, object.isFolder()).number(8, 0).text(object.picture.name).text(date).text(date);
  return writer.text("");
}

Answer property(Camera& camera, const Request& request) {
  const auto code = static_cast<std::uint16_t>(request.parameters[0]);
  const auto found = camera.properties.find(code);
  if (found == camera.properties.end()) return kNoProperty;
  Property& property = found->second;
  if (request.operation == 0x1015) return Writer().number(property.width, property.value);
  if (request.operation == 0x1014) {
    Writer writer;
    writer.number(2, code).number(2, property.width == 4 ? 6 : 2 * property.width).number(1, property.writable);
    writer.number(property.width, property.value).number(property.width, property.value);
    if (property.choices.empty()) return writer.number(1, 1).number(1, 0).number(1, 100).number(1, 1);  // percent
    writer.number(1, 2).number(2, property.choices.size());
    for (const std::uint64_t choice : property.choices) writer.number(property.width, choice);
    return writer;
  }
  std::string_view rest = request.data;
  const auto value = take<std::uint32_t>(rest);
  note("note write " + hexadecimal(code) + ' ' + std::to_string(value));
  if (property.writable) property.value = value;
  return property.writable ? kGood : kAccessDenied;
}

class Session {
 public:
  Session(Studio& studio, Connection& connection) : _studio(studio), _connection(connection) {}

  void run() {
    Packet packet;
    while (_connection.receive(packet)) {
      if (packet.type == kProbe) _connection.send(Writer().packet(kProbeAnswer));
      if (packet.type != kRequest) continue;
      std::string_view rest = packet.body;
      const bool dataFollow = take<std::uint32_t>(rest) == 2;
      Request request;
      request.operation = take<std::uint16_t>(rest);
      request.transaction = take<std::uint32_t>(rest);
      for (std::uint32_t& parameter : request.parameters) parameter = take<std::uint32_t>(rest);
      while (dataFollow && packet.type != kEndData) {
        if (!_connection.receive(packet)) return;
        if (packet.type != kStartData) request.data += packet.body.substr(std::min<std::size_t>(4, packet.body.size()));
      }
      if (!carryOut(request)) return;
    }
  }

 private:
  bool carryOut(const Request& request) {
    std::optional<Fault> fault;
    Answer answer = kBusy;
    std::string of;
    {
      const Guard guard(_studio.lock);
      Camera& camera = _studio.camera;
      while (camera.commandsSilent) _studio.changed.wait(_studio.lock);
      ++camera.asked[request.operation];
      if (const auto object = camera.objects.find(request.parameters[0]); object != camera.objects.end())
        of = object->second.picture.name;
      fault = camera.insteadOf(request.operation, of);
      if (!fault) {
        answer = perform(camera, request);
        fault = camera.insteadOf(request.operation, of, true, answer.first, answer.size);
      }
    }
    const bool sent = fault ? sendInstead(request, answer, *fault) : send(request, answer, answer.size);
    if (request.operation == 0x100E && answer.code == kGood) expose(request.transaction);
    if (sent && answer.picture && answer.first + answer.size == answer.picture->size) note("note read " + of);
    return sent;
  }

  // The picture comes after the answer to the order.
  void expose(std::uint32_t transaction) {
    const Guard guard(_studio.lock);
    note("note captured" + _studio.camera.shoot(1));
    _studio.camera.announce(kCaptureComplete, transaction);
  }

  Answer perform(Camera& camera, const Request& request) {
    const auto [first, second, third] = request.parameters;
    if (std::find(camera.operations.begin(), camera.operations.end(), request.operation) == camera.operations.end())
      return kNotSupported;
    if (request.operation == 0x1001) return deviceInfo(camera);
    if (request.operation == 0x1002 || request.operation == 0x1003) {
      _open = request.operation == 0x1002;
      return kGood;
    }
    if (!_open) return kNotOpen;
    if (request.operation == 0x1004) return Writer().array(4, std::vector{kStorage});
    if (request.operation == 0x1005) return storageInfo(camera);
    if (request.operation == 0x1006) return Answer(kGood, camera.handles(third, second).size());
    if (request.operation == 0x1007) return Writer().array(4, camera.handles(third, second));
    if (request.operation == 0x100E) return camera.hasRoom() ? kGood : kStoreFull;
    if (request.operation >= 0x1014 && request.operation <= 0x1016) return property(camera, request);
    const auto found = camera.objects.find(first);
    if (found == camera.objects.end()) return kNoObject;
    const Picture& picture = found->second.picture;
    if (request.operation == 0x1008) return objectInfo(first, found->second);
    if (request.operation == 0x1009) return Answer(picture, 0, picture.size);
    if (request.operation == 0x100A)
      return Writer().raw(Picture{.name = "THUMBNAIL.JPG", .size = kThumbnail}.bytes(0, kThumbnail));
    if (request.operation == 0x101B) return Answer(picture, second, third);
    note("note delete " + picture.name);
    camera.objects.erase(found);
    return kGood;
  }

  bool sendInstead(const Request& request, Answer& answer, const Fault& fault) {
    const std::uint64_t announced = answer.size, at = fault.at.value_or(0);
    const Picture nonsense{.name = "nonsense", .size = announced + at + 64};
    if (fault.kind == "answer") answer.code = static_cast<std::uint16_t>(fault.at.value_or(kBusy));
    if (fault.kind == "lose") return true;
    if (fault.kind == "noise") return _connection.send(nonsense.bytes(16, at == 0 ? 64 : at));
    if (fault.kind == "garbage") {
      answer.picture.reset();
      answer.data = nonsense.bytes(16, announced);
    }
    if (fault.kind == "more") answer.size += at;
    if (fault.kind == "short" || fault.kind == "clip") answer.size = std::min(answer.size, at);
    if (fault.kind == "clip" && !answer.parameters.empty()) answer.parameters[0] = static_cast<std::uint32_t>(at);
    return send(request, answer, fault.kind == "short" ? announced : answer.size, &fault);
  }

  // With a fault that stops it, as far as that.
  bool send(const Request& request, const Answer& answer, std::uint64_t announced, const Fault* fault = nullptr) {
    const bool stops = fault && (fault->kind == "cut" || fault->kind == "stall");
    const std::uint64_t place = stops ? std::max(fault->at.value_or(0), answer.first) - answer.first : 0;
    if (stops && place == 0 && !goesOn(*fault)) return false;
    const Writer head = Writer().number(4, request.transaction);
    if (answer.withData && !_connection.send(Writer(head).number(8, announced).packet(kStartData))) return false;
    for (std::uint64_t at = 0, length = 1; answer.withData && length > 0 && (at == 0 || at < answer.size);
         at += length) {
      length = std::min(mostAtOnce(), (at < place ? place : answer.size) - at);
      const std::uint32_t type = at + length < answer.size ? kData : kEndData;
      if (!_connection.send(Writer(head).raw(answer.bytes(at, length)).packet(type))) return false;
      if (length > 0 && stops && at + length == place && !goesOn(*fault)) return false;
    }
    Writer response = Writer().number(2, answer.code).number(4, request.transaction);
    for (const std::uint32_t parameter : answer.parameters) response.number(4, parameter);
    return _connection.send(response.packet(kResponse));
  }

  // A link with so many bytes a second takes a fiftieth of them at a time.
  std::uint64_t mostAtOnce() {
    constexpr std::uint64_t kMost = 64 * 1024;
    const Guard guard(_studio.lock);
    const std::uint64_t rate = _studio.camera.rate;
    if (rate == 0) return kMost;
    _due = std::max(_due, Clock::now());
    while (Clock::now() < _due) _studio.changed.waitUntil(_studio.lock, _due);
    const std::uint64_t length = std::clamp<std::uint64_t>(rate / 50, 1, kMost);
    _due += std::chrono::microseconds(length * 1'000'000 / rate);
    return length;
  }

  bool goesOn(const Fault& fault) {
    const Guard guard(_studio.lock);
    if (fault.kind == "stall") pause(fault.milliseconds);
    if (fault.kind == "cut") _studio.camera.cut(true, true);
    return fault.kind == "stall";
  }

  // Until resumed where there is no time.
  void pause(int milliseconds) REQUIRES(_studio.lock) {
    const auto until = Clock::now() + std::chrono::milliseconds(milliseconds);
    const unsigned before = _studio.camera.resumed;
    while (_studio.camera.resumed == before && (milliseconds == 0 || Clock::now() < until))
      milliseconds == 0 ? _studio.changed.wait(_studio.lock) : void(_studio.changed.waitUntil(_studio.lock, until));
  }

  Studio& _studio;
  Connection& _connection;
  Clock::time_point _due{};
  bool _open = false;
};

}  // namespace

void serve(Studio& studio, const std::shared_ptr<Connection>& connection) {
  Packet packet;
  Writer greeting = Writer().number(4, 1).raw("a camera's GUID.");
  if (!connection->receive(packet)) packet.type = 0;
  {
    const Guard guard(studio.lock);
    while (studio.camera.commandsSilent) studio.changed.wait(studio.lock);
    for (const char letter : studio.camera.model) greeting.number(2, static_cast<unsigned char>(letter));
    if (studio.camera.held) {
      connection->send(Writer().number(4, 2).packet(kInitRefused));
      note("note refused");
    } else if (packet.type == kInitEvent) {
      connection->send(Writer().packet(kInitEventAnswer));
      for (Line& line : studio.camera.lines) line.ofEvents |= line.connection == connection;
    } else if (packet.type == kInitCommand) {
      connection->send(greeting.number(2, 0).number(4, 0x00010000).packet(kInitCommandAnswer));
      note("note connected");
    }
  }
  Session(studio, *connection).run();
  if (packet.type == kInitCommand) note("note disconnected");
  const Guard guard(studio.lock);
  studio.camera.lines.remove_if([&](const Line& line) { return line.connection == connection; });
}

}  // namespace ptpip
