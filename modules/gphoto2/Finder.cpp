#include "Finder.h"

#include <algorithm>
#include <cstdlib>
#include <sstream>
#include <thread>

#include "Library.h"
#include "Log.h"
#include "Signals.h"

namespace gphoto2camera {
namespace {

using camerakit::Guard;
using Clock = std::chrono::steady_clock;

constexpr std::chrono::milliseconds kBetweenLooks{2000};
constexpr std::chrono::milliseconds kLongestEnd{1000}, kEndStep{5};

// The library's driver for a port that says nothing of the camera behind it.
std::string driverFor(const std::string& port) {
  if (port.starts_with("ptpip:")) return "PTP/IP Camera";
  return port.starts_with("disk:") ? "Directory Browse" : "";
}

std::vector<Address> listedCameras() {
  const char* list = std::getenv("TETHER_CAMERAS");
  std::istringstream stream(list != nullptr ? list : "");
  std::vector<Address> found;
  for (std::string port; stream >> port;) {
    const Address address{driverFor(port), port};
    if (address.model.empty())
      log(port, "is no port of a camera on a network; they look like ptpip:192.168.1.7");
    else if (std::find(found.begin(), found.end(), address) == found.end())
      found.push_back(address);
  }
  return found;
}

bool isUsb(const Address& address) { return address.port.starts_with("usb:"); }

}  // namespace

void Finder::start() {
  const Guard guard(_mutex);
  const int round = ++_round;
  for (const Address& address : listedCameras()) add(address);
  std::thread([this, round] { run(round); }).detach();
}

void Finder::add(const Address& address) {
  _workers.push_back(std::make_shared<Worker>(_model, _roster, address));
  _workers.back()->start();
}

void Finder::stop() {
  std::vector<std::shared_ptr<Worker>> ending;
  {
    const Guard guard(_mutex);
    ++_round;
    ending.swap(_workers);
  }
  _bell.ring();
  for (const auto& worker : ending) worker->stop();
  const Clock::time_point until = Clock::now() + kLongestEnd;
  const auto hasEnded = [](const auto& worker) { return worker->hasEnded(); };
  while (!std::all_of(ending.begin(), ending.end(), hasEnded) && Clock::now() < until)
    std::this_thread::sleep_for(kEndStep);
}

void Finder::run(int round) {
  blockSignals();
  std::vector<std::string> ports;
  while (!isOver(round)) {
    look(ports, round);
    _bell.rest(kBetweenLooks);
  }
}

bool Finder::isOver(int round) const {
  const Guard guard(_mutex);
  return round != _round;
}

void Finder::look(std::vector<std::string>& ports, int round) {
  std::vector<std::string> now = Library::get().usbPorts();
  if (now == ports) return;
  ports = std::move(now);
  const std::vector<Address> found = Library::get().detect(ports);
  const Guard guard(_mutex);
  if (round != _round) return;
  const auto isGone = [&](const std::shared_ptr<Worker>& worker) {
    return isUsb(worker->address()) && std::find(found.begin(), found.end(), worker->address()) == found.end();
  };
  for (const auto& worker : _workers)
    if (isGone(worker)) worker->stop();
  std::erase_if(_workers, isGone);
  for (const Address& address : found)
    if (std::none_of(_workers.begin(), _workers.end(), [&](const auto& w) { return w->address() == address; }))
      add(address);
}

}  // namespace gphoto2camera
