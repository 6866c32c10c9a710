// PTP/IP on the wire: numbers, packets, connections.
#pragma once

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <bit>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace ptpip {

static_assert(std::endian::native == std::endian::little, "numbers go out as they stand in memory");

enum PacketType : std::uint32_t { kInitCommand = 1, kInitCommandAnswer, kInitEvent, kInitEventAnswer, kInitRefused };
enum : std::uint32_t { kRequest = 6, kResponse, kEvent, kStartData, kData, kEndData = 12, kProbe, kProbeAnswer };

// One value after the other.
class Writer {
 public:
  Writer& number(std::size_t width, std::uint64_t value) { return raw({reinterpret_cast<const char*>(&value), width}); }
  Writer& raw(std::string_view bytes) {
    _bytes += bytes;
    return *this;
  }
  Writer& text(std::string_view ascii) {  // its length, two bytes a letter, and a zero
    if (ascii.empty()) return number(1, 0);
    number(1, ascii.size() + 1);
    for (const char letter : ascii) number(2, static_cast<unsigned char>(letter));
    return number(2, 0);
  }
  template <typename List>
  Writer& array(std::size_t width, const List& list) {
    number(4, list.size());
    for (const auto value : list) number(width, value);
    return *this;
  }
  const std::string& bytes() const { return _bytes; }
  std::string packet(std::uint32_t type) const {
    return Writer().number(4, _bytes.size() + 8).number(4, type).raw(_bytes).bytes();
  }

 private:
  std::string _bytes;
};

// The next number; past the end there are zeros.
template <typename Number>
Number take(std::string_view& from) {
  Number value{};
  const std::size_t length = std::min(sizeof value, from.size());
  std::memcpy(&value, from.data(), length);
  from.remove_prefix(length);
  return value;
}

struct Packet {
  std::uint32_t type = 0;
  std::string body{};
};

// One thread receives; any may send, which waits until all has gone, or end it.
class Connection {
 public:
  explicit Connection(int descriptor) : _descriptor(descriptor) {  // takes it over
    const int on = 1;
    setsockopt(_descriptor, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
  }
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;
  ~Connection() { close(_descriptor); }

  // False: it has ended, or what came is no packet.
  bool receive(Packet& packet) {
    std::string header(8, '\0');
    if (!read(header)) return false;
    std::string_view rest = header;
    const auto length = take<std::uint32_t>(rest);
    packet.type = take<std::uint32_t>(rest);
    if (length < header.size() || length > (1 << 20)) return false;
    packet.body.assign(length - header.size(), '\0');
    return packet.body.empty() || read(packet.body);
  }
  bool send(const std::string& bytes) {
    return ::send(_descriptor, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
  }
  void end() { shutdown(_descriptor, SHUT_RDWR); }

 private:
  bool read(std::string& to) {
    return recv(_descriptor, to.data(), to.size(), MSG_WAITALL) == static_cast<ssize_t>(to.size());
  }

  const int _descriptor;
};

}  // namespace ptpip
