// What precedes messages, byte by byte.
#include "platform/linux/BusHandshake.hpp"

#include <gtest/gtest.h>

#include "platform/ClientLimits.hpp"

namespace platform::linux_ {
namespace {

using namespace std::string_literals;

// User 1000, in hexadecimal as the handshake has it.
const std::string start = "\0AUTH EXTERNAL 31303030\r\n"s;
const std::string ok = "OK server\r\n";
const std::string no = "REJECTED EXTERNAL\r\n";

std::string repeated(const std::string& text, std::size_t times) {
  std::string all;
  while (times-- > 0) all += text;
  return all;
}

// Feeds `input` in pieces, as sockets cut it. "going", "done" or "failed", and what is left of the input.
std::string shakeHands(const std::string& input, std::size_t pieceSize, std::string& output) {
  BusHandshake handshake(1000, "server");
  std::string pending;
  for (std::size_t at = 0; at < input.size(); at += pieceSize) {
    pending += input.substr(at, pieceSize);
    std::string_view rest = pending;
    const auto progress = handshake.advance(rest, output);
    pending = rest;
    if (progress == BusHandshake::Progress::failed) return "failed";
    if (progress == BusHandshake::Progress::done)
      return "done " + pending + input.substr(std::min(at + pieceSize, input.size()));
  }
  return "going";
}

TEST(BusHandshakeTest, AnswersAreTheSameInWhateverPiecesItComes) {
  const struct {
    const char* name;
    std::string input, result, output;
  } rows[] = {
      {"user named", start + "BEGIN\r\n", "done ", ok},
      {"messages behind it", start + "NEGOTIATE_UNIX_FD\r\nBEGIN\r\nl\1\r\n", "done l\1\r\n",
       ok + "ERROR\r\n"},
      {"another user when asked", "\0AUTH EXTERNAL\r\nDATA 30\r\nDATA\r\nBEGIN\r\n"s, "failed",
       "DATA\r\n" + no + "ERROR\r\n"},
      {"right at the second try", "\0AUTH EXTERNAL 30\r\nAUTH EXTERNAL 31303030\r\nBEGIN\r\n"s, "done ",
       no + ok},
      {"other mechanisms", "\0AUTH\r\nAUTH ANONYMOUS\r\nBEGIN\r\n"s, "failed", no + no},
      {"data after a change of mind", "\0AUTH EXTERNAL\r\nCANCEL\r\nDATA\r\nBEGIN\r\n"s, "failed",
       "DATA\r\n" + no + "ERROR\r\n"},
      {"nothing said", "\0BEGIN\r\n"s, "failed", ""},
      {"no zero byte", "AUTH EXTERNAL 31303030\r\nBEGIN\r\n", "failed", ""},
      {"an end of line alone", start + "BEGIN\n", "going", ok},
      {"as many lines as allowed", start + repeated("?\r\n", limits::handshakeLines - 2) + "BEGIN\r\n",
       "done ", ok + repeated("ERROR\r\n", limits::handshakeLines - 2)},
      {"a line too many", start + repeated("?\r\n", limits::handshakeLines - 1) + "BEGIN\r\n", "failed",
       ok + repeated("ERROR\r\n", limits::handshakeLines - 1)},
      {"a line too long", start + std::string(limits::handshakeBytes, 'x'), "failed", ok},
      {"lines too long together", start + repeated(std::string(limits::handshakeBytes / 4, 'x') + "\r\n", 4),
       "failed", ok + repeated("ERROR\r\n", 3)},
  };
  for (const auto& row : rows) {
    for (const std::size_t pieceSize : {std::size_t{1}, std::size_t{7}, row.input.size()}) {
      std::string output;
      EXPECT_EQ(shakeHands(row.input, pieceSize, output), row.result) << row.name << " by " << pieceSize;
      EXPECT_EQ(output, row.output) << row.name << " by " << pieceSize;
    }
  }
}

// Little-endian, but for `order`.
std::string header(std::uint32_t body, std::uint32_t fields, char order = 'l') {
  std::string bytes{order, 1, 0, 1};
  for (const std::uint32_t number : {body, 7u, fields}) {
    for (unsigned index = 0; index < 4; ++index)
      bytes += static_cast<char>(number >> 8 * (order == 'l' ? index : 3 - index));
  }
  return bytes;
}

TEST(BusMessageLengthTest, IsKnownFromTheFixedHeaderAlone) {
  EXPECT_EQ(busMessageLength(header(0, 0).substr(0, 15), 1024).value(), std::nullopt);
  EXPECT_EQ(busMessageLength(header(3, 9), 1024).value(), 35u) << "fields are padded, a body is not";
  EXPECT_EQ(busMessageLength(header(984, 24, 'B') + "more", 1024).value(), 1024u) << "the limit";
  for (const std::string& large : {header(985, 24), header(0xffffffff, 0), header(0xffffffff, 0xfffffff9)})
    EXPECT_EQ(busMessageLength(large, 1024).error(), Outcome::tooLarge);
}

}  // namespace
}  // namespace platform::linux_
