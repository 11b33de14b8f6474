// What every fuzz target shares: a scratch filesystem root on /dev/shm, made
// once per process, with fakes of every platform service installed beneath it
// (the log discards its lines so that a long run does not grow), and checks
// that stop the run when a property that must hold does not.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "platform/message_ipc.h"
#include "platform/plist.h"
#include "platform/root.h"

namespace kestrel::fuzz {

// Makes the scratch root and installs the fakes on the first call; later calls
// return the same root. The root lives under $KESTREL_FUZZ_SCRATCH (default
// /dev/shm) and is removed when the process exits normally.
const platform::FilesystemRoot& environment();

// Replaces the file at path (an absolute path on this machine) with bytes,
// making its parent directories. Aborts when it cannot be written.
void writeFileOrDie(const std::string& path, std::span<const std::uint8_t> bytes);
void makeDirectoriesOrDie(const std::string& path);

// Whether this input is one of the one-in-n that also run a costly check whose
// code does not depend on the input's shape (rendering a description, say).
// Decided by a hash of the bytes, so an input always makes the same choice and
// a reproducer runs the check it failed.
bool sampled(std::span<const std::uint8_t> input, unsigned oneIn);

// Prints what went wrong and aborts, so that libFuzzer keeps the input.
[[noreturn]] void fail(const char* what, const std::string& detail = {});
#define KESTREL_FUZZ_CHECK(condition, detail)                                     \
  do {                                                                            \
    if (!(condition)) ::kestrel::fuzz::fail("check failed: " #condition, detail); \
  } while (0)

// Equality of property lists and message values as a round trip must keep
// them: like operator==, except that a NaN equals a NaN (it cannot equal
// itself) and, with datesAsReals, a date equals the real holding its seconds.
bool plistEquivalent(const PlistValue& a, const PlistValue& b, bool datesAsReals = false);
bool messageEquivalent(const platform::MessageValue& a, const platform::MessageValue& b);

// Whether every string and dictionary key of the value is plain ASCII without
// a NUL byte: such a value always serialises.
bool plistIsPlainAscii(const PlistValue& value);
// The deepest nesting of arrays and dictionaries (a scalar is 0, a flat
// dictionary 1).
std::size_t plistContainerDepth(const PlistValue& value);

}  // namespace kestrel::fuzz
