// A camera on the network, PTP/IP on the loopback, for tests: ptpip_camera [PORT].
//
// It begins by saying `port N` and ends with its standard input. Every line there is an order, answered by one line,
// `ok ...` or `error ...`, which somebody has to read; lines that begin with `note` come by themselves (connected,
// disconnected, refused, captured NAME..., read NAME when its last byte was sent, delete NAME, write CODE VALUE, fault
// CODE KIND NAME). Codes are hexadecimal. Words with = may be left out.
//
//   model TEXT | serial TEXT       before somebody connects
//   without CODE                   an operation that it does not have
//   folder NAME                    pictures go there from now on
//   fill COUNT [size=N] [each=N]   pictures that nobody hears of; 1,000 in each folder
//   roll EXT[+EXT] [SIZE[+SIZE]]   the files of each shot from now on, in order: roll NEF+JPG 25000000+8000000
//   shoot [COUNT]                  on the body, while there is room; answers with the names
//   add NAME SIZE [seed=N] [head=PATH]  one file, which begins with what is in that one
//   remove NAME | set CODE VALUE   on the body
//   event CODE PARAMETER           any event
//   free BYTES                     room on the card
//   link RATE                      bytes a second, 0 for no limit
//   silence commands|events|all|none  what is not heard now is answered later
//   hold | release                 by somebody else: who connects is refused
//   cut commands|events|all        these connections, now
//   unplug | plug                  all connections end, new ones at once; they can be had again
//   fault CODE|any KIND [AT] [ms=N] [skip=N] [times=N] [of=NAME]  see Camera.h; of `answer`, AT is hexadecimal
//   resume                         whatever stands still
//   counts                         what was asked for, deletes, writes, open connections
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iostream>
#include <iterator>
#include <map>
#include <set>
#include <sstream>
#include <stdexcept>
#include <system_error>
#include <thread>

#include "Camera.h"

namespace ptpip {
namespace {

std::vector<std::string> split(const std::string& text, char at) {
  std::vector<std::string> parts;
  std::istringstream stream(text);
  for (std::string part; std::getline(stream, part, at);) parts.push_back(part);
  return parts;
}

struct Order {
  explicit Order(const std::string& line) {
    for (const std::string& word : split(line, ' '))
      if (const std::size_t equals = word.find('='); equals != std::string::npos)
        options[word.substr(0, equals)] = word.substr(equals + 1);
      else if (!word.empty())
        words.push_back(word);
    rest = line.substr(std::min(line.size(), line.find(' ') + 1));
  }
  const std::string& word(std::size_t at) const { return words.at(at); }
  std::uint64_t number(std::size_t at) const { return std::stoull(word(at)); }
  std::uint16_t code(std::size_t at) const { return static_cast<std::uint16_t>(std::stoul(word(at), nullptr, 16)); }
  bool means(const char* what) const { return word(1) == what || word(1) == "all"; }
  std::uint64_t option(const char* name, std::uint64_t otherwise) const {
    return options.contains(name) ? std::stoull(options.at(name)) : otherwise;
  }

  std::vector<std::string> words{};
  std::map<std::string, std::string> options{};
  std::string rest{};
};

void roll(Camera& camera, const Order& order) {
  camera.roll = split(order.word(1), '+');
  if (order.words.size() < 3) return;
  camera.sizes.clear();
  for (const std::string& size : split(order.word(2), '+')) camera.sizes.push_back(std::stoull(size));
}

void add(Camera& camera, const Order& order) {
  Picture picture{.name = order.word(1), .size = order.number(2), .seed = order.option("seed", 0)};
  if (order.options.contains("head")) {
    std::ifstream file(order.options.at("head"), std::ios::binary);
    picture.head.assign(std::istreambuf_iterator<char>(file), {});
  }
  camera.add(camera.folder, picture);
}

void enter(Camera& camera, const std::string& name, bool announced = true) {
  const std::uint32_t known = camera.handleOf(name);
  camera.folder = known != 0 ? known : camera.add(1, {.name = name}, announced);
}

void fill(Camera& camera, const Order& order) {
  const std::uint64_t each = order.option("each", 1000), size = order.option("size", 200'000);
  for (std::uint64_t at = 0; at < order.number(1); ++at) {
    if (at > 0 && at % each == 0) enter(camera, std::to_string(100 + at / each) + "TEST", false);
    camera.add(camera.folder, {.name = "CARD" + std::to_string(1000 + at) + ".JPG", .size = size}, false);
  }
}

void remove(Camera& camera, const Order& order) {
  const std::uint32_t handle = camera.handleOf(order.word(1));
  if (camera.objects.erase(handle) > 0) camera.announce(kRemoved, handle);
}

void set(Camera& camera, const Order& order) {
  camera.properties.at(order.code(1)).value = order.number(2);
  camera.announce(kPropertyChanged, order.code(1));
}

const std::set<std::string> kFaults{"answer", "cut", "stall", "clip", "short", "more", "garbage", "noise", "lose"};

void plan(Camera& camera, const Order& order) {
  Fault fault{.operation = order.word(1) == "any" ? std::uint16_t{0} : order.code(1), .kind = order.word(2)};
  if (!kFaults.contains(fault.kind)) throw std::invalid_argument("no such fault");
  if (order.words.size() > 3) fault.at = fault.kind == "answer" ? order.code(3) : order.number(3);
  fault.milliseconds = static_cast<int>(order.option("ms", 0));
  fault.skip = static_cast<int>(order.option("skip", 0));
  fault.times = static_cast<int>(order.option("times", 1));
  if (order.options.contains("of")) fault.of = order.options.at("of");
  camera.faults.push_back(fault);
}

void unplug(Camera& camera, const Order&) {
  camera.plugged = false;
  camera.cut(true, true);
}

void silence(Camera& camera, const Order& order) {
  camera.commandsSilent = order.means("commands");
  camera.eventsSilent = order.means("events");
}

const std::map<std::string, std::function<void(Camera&, const Order&)>> kOrders{
    {"model", [](auto& camera, auto& order) { camera.model = order.rest; }},
    {"serial", [](auto& camera, auto& order) { camera.serial = order.rest; }},
    {"without", [](auto& camera, auto& order) { std::erase(camera.operations, order.code(1)); }},
    {"folder", [](auto& camera, auto& order) { enter(camera, order.word(1)); }},
    {"fill", fill},
    {"roll", roll},
    {"add", add},
    {"remove", remove},
    {"set", set},
    {"event", [](auto& camera, auto& order) { camera.announce(order.code(1), order.code(2)); }},
    {"free", [](auto& camera, auto& order) { camera.free = order.number(1); }},
    {"link", [](auto& camera, auto& order) { camera.rate = order.number(1); }},
    {"silence", silence},
    {"hold", [](auto& camera, auto&) { camera.held = true; }},
    {"release", [](auto& camera, auto&) { camera.held = false; }},
    {"cut", [](auto& camera, auto& order) { camera.cut(order.means("commands"), order.means("events")); }},
    {"unplug", unplug},
    {"plug", [](auto& camera, auto&) { camera.plugged = true; }},
    {"fault", plan},
    {"resume", [](auto& camera, auto&) { ++camera.resumed; }},
};

std::string obey(Camera& camera, const std::string& line) {
  try {
    const Order order(line);
    const std::string what = order.words.empty() ? "nothing" : order.word(0);
    if (what == "counts") return "ok" + camera.counts();
    if (what == "shoot") return "ok" + camera.shoot(order.words.size() > 1 ? order.number(1) : 1);
    const auto found = kOrders.find(what);
    if (found == kOrders.end()) return "error no order " + what;
    found->second(camera, order);
    return "ok";
  } catch (const std::exception& error) {
    return std::string("error ") + error.what();
  }
}

// On the loopback; 0 picks a port, which is said.
int listenOn(int port) {
  const int descriptor = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0), on = 1;
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  auto* const name = reinterpret_cast<sockaddr*>(&address);
  socklen_t size = sizeof address;
  setsockopt(descriptor, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
  if (bind(descriptor, name, size) != 0 || listen(descriptor, 64) != 0 || getsockname(descriptor, name, &size) != 0)
    throw std::system_error(errno, std::generic_category());
  note("port " + std::to_string(ntohs(address.sin_port)));
  return descriptor;
}

void welcome(Studio& studio, int listener) {
  for (;;) {
    const auto connection = std::make_shared<Connection>(accept(listener, nullptr, nullptr));
    const platform::Guard guard(studio.lock);
    if (!studio.camera.plugged) continue;
    studio.camera.lines.push_back({connection});
    std::thread(serve, std::ref(studio), connection).detach();
  }
}

}  // namespace
}  // namespace ptpip

int main(int count, char** arguments) {
  auto& studio = *new ptpip::Studio;  // its threads use it to the very end
  std::thread(ptpip::welcome, std::ref(studio), ptpip::listenOn(count > 1 ? std::atoi(arguments[1]) : 0)).detach();
  for (std::string line; std::getline(std::cin, line);) {
    const platform::Guard guard(studio.lock);
    const std::string answer = ptpip::obey(studio.camera, line);
    studio.camera.speak();
    studio.changed.notifyAll();
    ptpip::note(answer);
  }
  std::quick_exit(0);
}
