// Identifier locks: a reader/writer lock per identifier (a container's UUID
// string) and one process-wide lock on all identifiers, which exclude each other.
//
// Compatibility:
//   - identifier readers run beside each other and beside readers of all identifiers;
//   - an identifier writer excludes every other holder of the same identifier and
//     every holder of the lock on all identifiers;
//   - a reader of all identifiers excludes identifier writers and a writer of all
//     identifiers;
//   - a writer of all identifiers excludes everything.
//
// Lock order, outermost first: the lock on all identifiers; an identifier lock
// (never taken while the same operation holds the lock on all identifiers, nor
// the reverse: nesting is not supported); the hop onto the code-signing queue;
// the layout objects' locks; the container cache's mutex. Several identifiers
// taken at once are taken in ascending order, so two callers locking the same set
// never deadlock.
//
// Misuse (releasing what is not held, a parameter of the wrong type) is a
// programming error and aborts the process with the failed condition.
//
// Callers use the guards; the functions below them are the primitives:
//
//   KSTAllIdentifiersLockGuard all(kKSTLockForWriting);
//   KSTIdentifierLockGuard one(uuid, kKSTLockForReading);
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "platform/plist.h"

namespace kestrel {

inline constexpr bool kKSTLockForWriting = true;
inline constexpr bool kKSTLockForReading = false;

// Takes the lock of one identifier (a string) or of every identifier of an
// array (strings, taken in ascending order, each once). Any other parameter type
// logs "Unknown parameter type!" and aborts.
void _lock_identifier(const PlistValue& identifier, bool forWriting);
void _lock_identifier(const std::string& identifier, bool forWriting);
void _lock_identifier(const char* identifier, bool forWriting);
void _lock_identifier(const std::vector<std::string>& identifiers, bool forWriting);

// Releases what _lock_identifier took with the same parameter: an array is
// released in descending order, each distinct identifier once.
void unlock_identifier(const PlistValue& identifier);
void unlock_identifier(const std::string& identifier);
void unlock_identifier(const char* identifier);
void unlock_identifier(const std::vector<std::string>& identifiers);

// The lock on all identifiers.
void _lock_all_identifiers(bool forWriting);
void unlock_all_identifiers();

// The number of identifier lock records alive (identifiers locked or waited
// for). For tests and diagnostics.
std::size_t KSTLocksLiveRecordCount();

// Holds one identifier, or every identifier of an array, from construction to
// destruction (or to unlock()).
class KSTIdentifierLockGuard {
 public:
  KSTIdentifierLockGuard(PlistValue identifiers, bool forWriting);
  KSTIdentifierLockGuard(const std::string& identifier, bool forWriting);
  KSTIdentifierLockGuard(const char* identifier, bool forWriting);
  KSTIdentifierLockGuard(const std::vector<std::string>& identifiers, bool forWriting);
  ~KSTIdentifierLockGuard();

  KSTIdentifierLockGuard(KSTIdentifierLockGuard&& other) noexcept;
  KSTIdentifierLockGuard& operator=(KSTIdentifierLockGuard&&) = delete;
  KSTIdentifierLockGuard(const KSTIdentifierLockGuard&) = delete;
  KSTIdentifierLockGuard& operator=(const KSTIdentifierLockGuard&) = delete;

  // Releases early; the destructor then does nothing.
  void unlock();
  bool ownsLock() const { return held_; }

 private:
  PlistValue identifiers_;
  bool held_ = false;
};

// Holds the lock on all identifiers from construction to destruction (or to unlock()).
class KSTAllIdentifiersLockGuard {
 public:
  explicit KSTAllIdentifiersLockGuard(bool forWriting);
  ~KSTAllIdentifiersLockGuard();

  KSTAllIdentifiersLockGuard(KSTAllIdentifiersLockGuard&& other) noexcept;
  KSTAllIdentifiersLockGuard& operator=(KSTAllIdentifiersLockGuard&&) = delete;
  KSTAllIdentifiersLockGuard(const KSTAllIdentifiersLockGuard&) = delete;
  KSTAllIdentifiersLockGuard& operator=(const KSTAllIdentifiersLockGuard&) = delete;

  void unlock();
  bool ownsLock() const { return held_; }

 private:
  bool held_ = false;
};

}  // namespace kestrel
