#include "yomber/transfer_view.h"

#include <poll.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <iostream>

#include "platform/foundation/url.h"
#include "yomber/failure_text.h"
#include "yomber/item_output.h"

namespace yomber {

namespace {

constexpr std::size_t longestList = 10;
constexpr int redrawMilliseconds = 300;

const char* kindName(Transfer::Kind kind) {
  switch (kind) {
    case Transfer::Kind::UPLOAD:
      return "upload  ";
    case Transfer::Kind::DOWNLOAD:
      return "download";
    case Transfer::Kind::EVICT:
      return "evict   ";
  }
  return "transfer";
}

double fractionOf(const Transfer& transfer) {
  if (transfer.total == 0) return 0;
  return std::min(1.0, static_cast<double>(transfer.done) / static_cast<double>(transfer.total));
}

std::string bar(double fraction, std::size_t width) {
  const auto filled = static_cast<std::size_t>(fraction * static_cast<double>(width));
  return "[" + std::string(filled, '#') + std::string(width - filled, ' ') + "] ";
}

std::size_t terminalColumns() {
  constexpr std::size_t usual = 80;
  winsize size{};
  return ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0 ? size.ws_col : usual;
}

/// No line may wrap, or the next picture would be drawn elsewhere.
std::string cutToColumns(const std::string& line, std::size_t columns) {
  std::size_t used = 0;
  std::size_t end = 0;
  while (end < line.size() && used < columns) {
    ++end;
    while (end < line.size() && (static_cast<unsigned char>(line[end]) & 0xC0U) == 0x80U) ++end;
    ++used;
  }
  return line.substr(0, end);
}

/// Draws over what was drawn before; answers how many lines there are now.
std::size_t draw(const Transfers& transfers, std::size_t before) {
  constexpr std::size_t barWidth = 24;
  const std::size_t columns = terminalColumns();
  std::string out = before > 0 ? "\x1b[" + std::to_string(before) + "A\x1b[J" : "";
  std::size_t lines = 0;
  for (const Transfer& transfer : transfers.underWay) {
    if (lines == longestList) break;
    out += cutToColumns(transferLine(transfer, columns > 2 * barWidth ? barWidth : 0), columns - 1);
    out += "\n";
    ++lines;
  }
  out += cutToColumns("transfers      " + transferSummary(transfers), columns - 1) + "\n";
  std::cout << out << std::flush;
  return lines + 1;
}

}  // namespace

std::string transferLine(const Transfer& transfer, std::size_t barWidth) {
  std::string line = std::string(kindName(transfer.kind)) + "  ";
  const std::string name = printableName(NSURL(transfer.path).lastPathComponent());
  if (transfer.nextAttempt) {
    line += "waiting  " + name;
    if (transfer.failure) line += ": " + printableName(failureText(transfer.failure));
    return line;
  }
  const double fraction = fractionOf(transfer);
  constexpr double hundred = 100;
  const auto percent = std::to_string(static_cast<int>(fraction * hundred));
  line += std::string(percent.size() < 3 ? 3 - percent.size() : 0, ' ') + percent + "%  ";
  if (barWidth > 0) line += bar(fraction, barWidth);
  return line + readableSize(transfer.done) + " of " + readableSize(transfer.total) + "  " + name;
}

std::string transferSummary(const Transfers& transfers) {
  const std::uint64_t underWay = transfers.underWay.size();
  if (underWay == 0 && transfers.waiting == 0) return "none";
  // Those under way are among all that wait.
  const std::uint64_t others = std::max(transfers.waiting, underWay) - underWay;
  return std::to_string(underWay) + " under way, " + std::to_string(others) + " waiting";
}

NSErrorRef followTransfers(const ipc::Remote<protocol::Daemon>& daemon) {
  std::size_t lines = 0;
  while (true) {
    Transfers transfers;
    if (NSErrorRef error = DriveContent::transfers(daemon, transfers)) return error;
    lines = draw(transfers, lines);
    if (transfers.underWay.empty() && transfers.waiting == 0) return nullptr;
    poll(nullptr, 0, redrawMilliseconds);
  }
}

}  // namespace yomber
