// The code-signing mapping file with arbitrary contents, loaded into a fresh
// store per input: every entry is queried (group entitlements included), the
// store is written back and read again (entries must survive), and an
// invalidation and a removal run on the first entry.
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "codesigning/code_signing_entry.h"
#include "codesigning/code_signing_mapping.h"
#include "daemon/error_codes.h"
#include "platform/plist_serialization.h"
#include "support/fuzz_environment.h"

namespace {

using namespace kestrel;
using namespace kestrel::fuzz;
using State = KSTCodeSigningMappingState;

const KSTFileURL& mappingURL() {
  static const KSTFileURL url(
      environment().resolve(std::string("/private/var/fuzz/") + kKSTCodeSigningMappingFileName));
  return url;
}

bool sameEntry(const KSTCodeSigningEntry& a, const KSTCodeSigningEntry& b) {
  return plistEquivalent(PlistValue(a.serialize()), PlistValue(b.serialize()));
}

void query(State& state, const std::string& identifier) {
  const KSTCodeSigningEntry* entry = state.entryForIdentifier(identifier);
  KESTREL_FUZZ_CHECK(entry != nullptr, identifier);
  (void)entry->description();
  (void)entry->hash();
  // The serialized form reads back as the same entry.
  const KSTCodeSigningEntry copy =
      KSTCodeSigningEntry::initWithSerializedDictionary(entry->serialize());
  KESTREL_FUZZ_CHECK(sameEntry(copy, *entry), entry->description());

  const auto info = state._onQueue_codeSigningInfoForIdentifier(identifier, true);
  KESTREL_FUZZ_CHECK(!info || !(entry->placeholder() || entry->invalid()),
                     "an external request sees a placeholder or invalid entry");
  (void)state._onQueue_codeSigningInfoExistForIdentifier(identifier);
  (void)state._onQueue_identifierHasCallerRegisteredEntitlements(identifier);
  (void)state._onQueue_identifierHasSystemContainer(identifier);
  (void)state._onQueue_dataContainerTypeForIdentifier(identifier);
  if (auto groups = state._onQueue_appGroupIdentifiersForIdentifier(identifier)) {
    for (std::size_t i = 0; i < groups->size(); ++i) {
      for (std::size_t j = i + 1; j < groups->size(); ++j) {
        KESTREL_FUZZ_CHECK((*groups)[i] != (*groups)[j], "a group named twice");
      }
    }
  }
  if (auto groups = state._onQueue_systemGroupIdentifiersForIdentifier(identifier)) {
    for (const std::string& group : *groups) {
      KESTREL_FUZZ_CHECK(group.starts_with(kKSTSystemGroupPrefix), group);
    }
  }
  const auto entitlements = state._onQueue_entitlementsForIdentifier(identifier);
  for (const char* key : {kKSTApplicationGroupsEntitlement, kKSTSystemGroupsEntitlement,
                          kKSTSystemGroupContainersEntitlement, kKSTSystemContainerEntitlement}) {
    (void)State::_copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, key);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  environment();
  const std::span<const std::uint8_t> bytes(data, size);
  writeFileOrDie(mappingURL().path(), bytes);

  std::unique_ptr<State> state = State::_readCodeSigningMappingFromDisk(mappingURL());
  const auto parsed = platform::parsePropertyList(bytes, nullptr);
  if (!state) {
    KESTREL_FUZZ_CHECK(!parsed || !parsed->isDictionary(), "a dictionary file was refused");
    return 0;
  }
  // The identifiers whose value is a dictionary; every other value is dropped.
  std::vector<std::string> identifiers;
  if (parsed && parsed->isDictionary()) {
    for (const auto& [identifier, value] : *parsed->dictionary()) {
      if (value.isDictionary())
        identifiers.push_back(identifier);
      else
        KESTREL_FUZZ_CHECK(state->entryForIdentifier(identifier) == nullptr, identifier);
    }
  }
  for (const std::string& identifier : identifiers) query(*state, identifier);

  std::size_t visited = 0;
  state->iterateGroupIdsWithKey(kKSTSystemGroupsEntitlement, kKSTSystemGroupContainersEntitlement,
                                [&](const std::string&, const KSTGroupIdentifiers&) { ++visited; });
  KESTREL_FUZZ_CHECK(visited == identifiers.size(), "iteration missed entries");

  // Written back and read again, every entry is the same.
  if (KSTErrorRef error = state->_writeCodeSigningMappingToDisk()) {
    KESTREL_FUZZ_CHECK(error->code() == kKSTErrorMappingWriteFailed, "unexpected write code");
  } else {
    const std::unique_ptr<State> reread = State::_readCodeSigningMappingFromDisk(mappingURL());
    KESTREL_FUZZ_CHECK(reread != nullptr, "a written mapping does not read back");
    for (const std::string& identifier : identifiers) {
      const KSTCodeSigningEntry* before = state->entryForIdentifier(identifier);
      const KSTCodeSigningEntry* after = reread->entryForIdentifier(identifier);
      KESTREL_FUZZ_CHECK(after != nullptr && sameEntry(*before, *after), identifier);
    }
  }

  if (identifiers.empty()) return 0;
  const std::string& first = identifiers.front();
  (void)state->_onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(first);
  KESTREL_FUZZ_CHECK(state->entryForIdentifier(first)->invalid(), first);
  const auto children = state->entryForIdentifier(first)->childBundleIdentifiers();
  state->_onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(first);
  KESTREL_FUZZ_CHECK(state->entryForIdentifier(first) == nullptr, first);
  for (const std::string& child : children.value_or(std::vector<std::string>{})) {
    KESTREL_FUZZ_CHECK(state->entryForIdentifier(child) == nullptr, child);
  }
  return 0;
}
