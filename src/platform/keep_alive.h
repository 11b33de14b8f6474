// Keep-alive transactions: while any is open the daemon has work in hand and
// must not be stopped for being idle.
#pragma once

#include <cstdint>
#include <memory>

namespace kestrel::platform {

class KeepAlive {
 public:
  virtual ~KeepAlive() = default;
  virtual void begin() = 0;
  virtual void end() = 0;
  virtual std::uint64_t openTransactions() const = 0;
};

// One transaction, open for the lifetime of the object.
class KeepAliveTransaction {
 public:
  explicit KeepAliveTransaction(std::shared_ptr<KeepAlive> keepAlive)
      : keepAlive_(std::move(keepAlive)) {
    if (keepAlive_) keepAlive_->begin();
  }
  ~KeepAliveTransaction() {
    if (keepAlive_) keepAlive_->end();
  }
  KeepAliveTransaction(const KeepAliveTransaction&) = delete;
  KeepAliveTransaction& operator=(const KeepAliveTransaction&) = delete;

 private:
  std::shared_ptr<KeepAlive> keepAlive_;
};

}  // namespace kestrel::platform
