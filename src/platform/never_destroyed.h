// Storage for a process-wide object that is made on first use and never torn
// down. The daemon's singletons are used by work that may still be running
// on other threads when the process ends (a death-row sweep, a queued retry);
// destroying them from the static destructors would pull them away from
// under that work. The object lives in static storage, so nothing leaks
// that would not have lived as long anyway.
//
//   KSTGlobalConfiguration& KSTGlobalConfiguration::sharedInstance() {
//     static platform::NeverDestroyed<KSTGlobalConfiguration> instance(
//         [](void* where) { return new (where) KSTGlobalConfiguration(); });
//     return *instance;
//   }
//
// The maker runs inside the caller, so private constructors stay private.
#pragma once

#include <new>
#include <utility>

namespace kestrel::platform {

template <typename T>
class NeverDestroyed {
 public:
  // make(where) constructs the object at where (placement new) and returns it.
  template <typename Make>
  explicit NeverDestroyed(Make&& make) {
    object_ = std::forward<Make>(make)(static_cast<void*>(storage_));
  }

  NeverDestroyed(const NeverDestroyed&) = delete;
  NeverDestroyed& operator=(const NeverDestroyed&) = delete;

  T& operator*() const { return *object_; }
  T* operator->() const { return object_; }

 private:
  alignas(T) unsigned char storage_[sizeof(T)];
  T* object_ = nullptr;
};

}  // namespace kestrel::platform
