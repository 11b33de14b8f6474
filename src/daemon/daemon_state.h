// Process-wide state made once by start-up and never freed: the work queues,
// whether the lock-state queue is held for a locked device, and the list of
// valid user ids.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/dispatch.h"

namespace kestrel {

inline constexpr const char* kKSTServiceName = "com.zorvane.kestreld";
inline constexpr const char* kKSTUpcallServiceName = "com.zorvane.kestreld.upcall";
inline constexpr const char* kKSTLogFileName = "kestreld.log";
inline constexpr const char* kKSTFirstBootSemaphoreName = "kestreld.fb_check";
inline constexpr const char* kKSTDeathRowQueueLabel = "com.zorvane.kestreld.deathrow";
inline constexpr const char* kKSTLockStateQueueLabel = "com.zorvane.kestreld.lockstate";
inline constexpr const char* kKSTListenerQueueLabel = "com.zorvane.kestreld.listener";
inline constexpr std::uint32_t kKSTDefaultMobileUserId = 501;

// Serial, background priority: destruction of what is on death row.
std::shared_ptr<platform::DispatchQueue> KSTDeathRowQueue();
// Serial, held still while the device is locked.
std::shared_ptr<platform::DispatchQueue> KSTLockStateQueue();
// Concurrent: every client request.
std::shared_ptr<platform::DispatchQueue> KSTListenerQueue();

// Made by start-up (steps that create the queues); false when either could not be made.
bool KSTCreateWorkQueues();
void KSTSetListenerQueue(std::shared_ptr<platform::DispatchQueue> queue);

// Reads the device's lock state and holds or releases the lock-state queue.
// Runs on the main queue.
void KSTLockStateChanged();
// True while this process holds the lock-state queue suspended.
bool KSTIsLocked();

// Begins a keep-alive transaction, runs the block asynchronously on the queue
// and ends the transaction after the block returned.
void KSTDispatchAsyncWithTransaction(const std::shared_ptr<platform::DispatchQueue>& queue,
                                     std::function<void()> block);

// Calls the block once for each valid user id: the user sessions of a
// multi-user device, else 501 alone.
void KSTForEachValidUserId(const std::function<void(std::uint32_t userId)>& block);

}  // namespace kestrel
