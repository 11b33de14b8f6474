// Keep-alive transactions on Linux: a counter of open transactions, reported to
// the service manager as the unit's status line when running under systemd.
#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>

#include "platform/keep_alive.h"

namespace kestrel::platform {

class LinuxKeepAlive final : public KeepAlive {
 public:
  // Reports to the service manager only when NOTIFY_SOCKET is set.
  LinuxKeepAlive();

  void begin() override;
  // Aborts when no transaction is open: an unmatched end() is a programming error.
  void end() override;
  std::uint64_t openTransactions() const override;

 private:
  void report();

  std::atomic<std::uint64_t> open_{0};
  const bool notify_;
  std::mutex reportMutex_;
};

}  // namespace kestrel::platform
