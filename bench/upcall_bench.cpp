// Upcall benchmark: process-containers upcalls per second to a running
// kestreld, for an existing app's containers (warm: the first upcall made
// them), against the floor measured in the same run: a datagram echoed by a
// trivial server, in a process of its own, on the same kind of socket
// (SOCK_SEQPACKET, one connection, one request at a time).
//
//   kestrel_upcall_bench --socket PATH --out DIR [--seconds S]
//
// The phases alternate (echo, upcall, echo, upcall, ...) so that a machine
// that slows down during the run slows both. Writes DIR/upcall_bench.json.
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "platform/linux/upcall_client_linux.h"
#include "platform/unique_fd.h"
#include "upcall/packbuff.h"
#include "upcall/upcall_items.h"
#include "upcall/upcall_messages.h"

namespace {

using Clock = std::chrono::steady_clock;
using kestrel::platform::UniqueFd;
using kestrel::platform::UpcallClient;

constexpr int kRounds = 3;

std::vector<std::uint8_t> appRequest() {
  using namespace kestrel;
  PackbuffRef buffer = sb_packbuff_new(256);
  const std::string app = "com.zorvane.kestrel.bench.app";
  sb_packbuff_pack_string(buffer.get(), kKSTUpcallRequestCodeSignatureId, app.c_str(), app.size());
  sb_packbuff_pack_uint32(buffer.get(), kKSTUpcallRequestPersonaId, 501);
  sb_packbuff_pack_uint32(buffer.get(), kKSTUpcallRequestContainerType, 0);
  return KSTUpcallComplexMessage(
      kKSTUpcallSendOnceDisposition, 0, kKSTUpcallProcessContainersId,
      {sb_packbuff_get_bytes(buffer.get()), sb_packbuff_get_size(buffer.get())}, false);
}

// Whether the reply gives the containers: return code 0, status 1 last.
bool complete(const std::vector<std::uint8_t>& datagram) {
  using namespace kestrel;
  std::string error;
  const auto reply = KSTUpcallParseReply(datagram, &error);
  if (!reply || reply->returnCode != 0 || reply->region.size() < 16) return false;
  std::uint32_t status = 0;
  std::memcpy(&status, reply->region.data() + reply->region.size() - 12, sizeof status);
  return status == 1;
}

// The floor: answers each datagram with itself until the connection closes.
[[noreturn]] void serveEcho(int listener) {
  UniqueFd connection(::accept(listener, nullptr, nullptr));
  std::vector<std::uint8_t> buffer(64 * 1024);
  for (;;) {
    const ssize_t size = ::recv(connection.get(), buffer.data(), buffer.size(), 0);
    if (size <= 0 || ::send(connection.get(), buffer.data(), size_t(size), MSG_NOSIGNAL) < 0) {
      ::_exit(0);
    }
  }
}

pid_t startEchoServer(const std::string& path) {
  UniqueFd listener(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  ::unlink(path.c_str());
  if (::bind(listener.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener.get(), 1) != 0) {
    return -1;
  }
  const pid_t pid = ::fork();
  if (pid == 0) serveEcho(listener.get());
  return pid;
}

struct Phase {
  std::vector<double> micros;
  double seconds = 0;
  std::size_t replyBytes = 0;

  double percentile(double p) const {
    std::vector<double> sorted = micros;
    std::sort(sorted.begin(), sorted.end());
    return sorted.empty() ? 0 : sorted[std::size_t(p * double(sorted.size() - 1))];
  }
  double perSecond() const { return seconds > 0 ? double(micros.size()) / seconds : 0; }
};

// Round trips on the connection for the time given; false when one fails.
bool measure(UpcallClient& client, const std::vector<std::uint8_t>& request, double seconds,
             Phase* phase) {
  const auto start = Clock::now();
  const auto end = start + std::chrono::duration<double>(seconds);
  for (auto now = start; now < end;) {
    const UpcallClient::Outcome outcome = client.call(request);
    const auto after = Clock::now();
    if (outcome.status != UpcallClient::Status::Reply) {
      std::cerr << "a round trip failed: " << outcome.message << "\n";
      return false;
    }
    phase->replyBytes = outcome.reply.size();
    phase->micros.push_back(std::chrono::duration<double, std::micro>(after - now).count());
    now = after;
  }
  phase->seconds += std::chrono::duration<double>(Clock::now() - start).count();
  return true;
}

nlohmann::json summary(const Phase& phase) {
  return {{"requests", phase.micros.size()},  {"per_second", phase.perSecond()},
          {"p50_us", phase.percentile(0.5)},  {"p90_us", phase.percentile(0.9)},
          {"p99_us", phase.percentile(0.99)}, {"reply_bytes", phase.replyBytes}};
}

int run(int argc, char** argv) {
  std::string socket, out;
  double seconds = 3;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    if (option == "--socket") socket = argv[i + 1];
    if (option == "--out") out = argv[i + 1];
    if (option == "--seconds") seconds = std::stod(argv[i + 1]);
  }
  if (socket.empty() || out.empty()) {
    std::cerr << "usage: kestrel_upcall_bench --socket PATH --out DIR [--seconds S]\n";
    return 2;
  }
  std::filesystem::create_directories(out);
  const std::string echoPath = out + "/echo.sock";
  const pid_t echo = startEchoServer(echoPath);
  if (echo < 0) {
    std::cerr << "cannot start the echo server at " << echoPath << "\n";
    return 1;
  }
  std::string error;
  auto daemon = UpcallClient::connect(socket, &error);
  auto floor = UpcallClient::connect(echoPath, &error);
  if (!daemon || !floor) {
    std::cerr << "cannot connect: " << error << "\n";
    ::kill(echo, SIGTERM);
    return 1;
  }
  const std::vector<std::uint8_t> request = appRequest();
  Phase echoPhase, upcallPhase;
  bool ok = true;
  // Warm: the first upcall makes the containers, the next ones find them.
  if (!complete(daemon->call(request).reply)) {
    std::cerr << "the daemon did not give the app its containers\n";
    ::kill(echo, SIGTERM);
    return 1;
  }
  Phase warmUp;
  ok = measure(*daemon, request, 0.3, &warmUp) && measure(*floor, request, 0.3, &warmUp);
  for (int round = 0; ok && round < kRounds; ++round) {
    ok = measure(*floor, request, seconds / kRounds, &echoPhase) &&
         measure(*daemon, request, seconds / kRounds, &upcallPhase);
  }
  floor.reset();
  int status = 0;
  ::waitpid(echo, &status, 0);
  ::unlink(echoPath.c_str());
  if (!ok) return 1;

  const double latencyRatio = upcallPhase.percentile(0.5) / echoPhase.percentile(0.5);
  const double rateRatio = echoPhase.perSecond() / upcallPhase.perSecond();
  nlohmann::json result = {{"echo", summary(echoPhase)},
                           {"upcall", summary(upcallPhase)},
                           {"ratios",
                            {{"upcall_p50_over_echo_p50", latencyRatio},
                             {"echo_rate_over_upcall_rate", rateRatio},
                             {"target", "upcall time at most 2x the echo floor"},
                             {"met", rateRatio <= 2.0}}}};
  std::ofstream(out + "/upcall_bench.json") << result.dump(2) << "\n";
  std::printf("%-8s %10s %10s %10s %10s %8s\n", "phase", "per s", "p50 us", "p90 us", "p99 us",
              "bytes");
  for (const auto& [name, phase] :
       {std::pair{"echo", &echoPhase}, std::pair{"upcall", &upcallPhase}}) {
    std::printf("%-8s %10.0f %10.1f %10.1f %10.1f %8zu\n", name, phase->perSecond(),
                phase->percentile(0.5), phase->percentile(0.9), phase->percentile(0.99),
                phase->replyBytes);
  }
  std::printf("upcall p50 / echo p50: %.2fx; echo rate / upcall rate: %.2fx (target <= 2x: %s)\n",
              latencyRatio, rateRatio, rateRatio <= 2.0 ? "met" : "not met");
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const std::exception& e) {
    std::cerr << "kestrel_upcall_bench: " << e.what() << "\n";
    return 1;
  }
}
