#include "platform/extended_acl.h"

#include <cerrno>
#include <charconv>

namespace kestrel::platform {

namespace {

// The fixed part of a membership UUID: "KSTG", version 8, RFC 4122 variant.
constexpr Uuid::Bytes kMembershipPrefix = {0x4B, 0x53, 0x54, 0x47, 0x00, 0x00, 0x80, 0x00,
                                           0x80, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00};
constexpr std::size_t kGidOffset = 12;

constexpr std::string_view kRecordHeader = "kestrel-acl 1";

std::string_view tagName(std::uint32_t tag) {
  switch (tag) {
    case kACLTagExtendedAllow:
      return "allow";
    case kACLTagExtendedDeny:
      return "deny";
    default:
      return "undefined";
  }
}

std::optional<std::uint32_t> tagNamed(std::string_view name) {
  if (name == "allow") return kACLTagExtendedAllow;
  if (name == "deny") return kACLTagExtendedDeny;
  if (name == "undefined") return kACLTagUndefined;
  return std::nullopt;
}

std::string hex(std::uint32_t value) {
  char buffer[16];
  const auto result = std::to_chars(buffer, buffer + sizeof buffer, value, 16);
  return "0x" + std::string(buffer, result.ptr);
}

std::optional<std::uint32_t> parseHex(std::string_view text) {
  if (text.size() < 3 || text.substr(0, 2) != "0x") return std::nullopt;
  std::uint32_t value = 0;
  const char* first = text.data() + 2;
  const char* last = text.data() + text.size();
  const auto result = std::from_chars(first, last, value, 16);
  if (result.ec != std::errc() || result.ptr != last) return std::nullopt;
  return value;
}

// Splits off the text up to the separator (or all of it).
std::string_view takeUntil(std::string_view* text, char separator) {
  const std::size_t at = text->find(separator);
  const std::string_view head = text->substr(0, at);
  text->remove_prefix(at == std::string_view::npos ? text->size() : at + 1);
  return head;
}

bool validEntry(const AccessControlList& acl, ACLEntryIndex entry) {
  return entry < acl.entries.size();
}

}  // namespace

Uuid groupMembershipUUID(gid_t gid) {
  Uuid::Bytes bytes = kMembershipPrefix;
  const auto value = static_cast<std::uint32_t>(gid);
  bytes[kGidOffset] = static_cast<std::uint8_t>(value >> 24);
  bytes[kGidOffset + 1] = static_cast<std::uint8_t>(value >> 16);
  bytes[kGidOffset + 2] = static_cast<std::uint8_t>(value >> 8);
  bytes[kGidOffset + 3] = static_cast<std::uint8_t>(value);
  return Uuid(bytes);
}

std::optional<gid_t> gidOfGroupMembershipUUID(const Uuid& uuid) {
  const Uuid::Bytes& bytes = uuid.bytes();
  for (std::size_t i = 0; i < kGidOffset; ++i) {
    if (bytes[i] != kMembershipPrefix[i]) return std::nullopt;
  }
  return static_cast<gid_t>(
      (std::uint32_t{bytes[kGidOffset]} << 24) | (std::uint32_t{bytes[kGidOffset + 1]} << 16) |
      (std::uint32_t{bytes[kGidOffset + 2]} << 8) | std::uint32_t{bytes[kGidOffset + 3]});
}

std::string encodeAccessControlList(const AccessControlList& acl) {
  std::string text(kRecordHeader);
  text += '\n';
  for (const AccessControlEntry& entry : acl.entries) {
    text += tagName(entry.tag);
    text += ' ';
    text += entry.qualifier.string();
    text += ' ';
    text += hex(entry.permissions);
    text += ' ';
    text += hex(entry.flags);
    text += '\n';
  }
  return text;
}

std::optional<AccessControlList> decodeAccessControlList(std::string_view text) {
  if (text.find('\n') == std::string_view::npos || takeUntil(&text, '\n') != kRecordHeader) {
    return std::nullopt;
  }
  AccessControlList acl;
  while (!text.empty()) {
    if (text.find('\n') == std::string_view::npos) return std::nullopt;  // unterminated
    std::string_view line = takeUntil(&text, '\n');
    const auto tag = tagNamed(takeUntil(&line, ' '));
    const auto qualifier = Uuid::parse(takeUntil(&line, ' '));
    const auto permissions = parseHex(takeUntil(&line, ' '));
    const auto flags = parseHex(line);
    if (!tag || !qualifier || !permissions || !flags) return std::nullopt;
    if (acl.entries.size() == kACLMaxEntries) return std::nullopt;
    acl.entries.push_back(AccessControlEntry{*tag, *permissions, *flags, *qualifier});
  }
  return acl;
}

int ExtendedACL::init(int count, AccessControlList* acl) {
  if (count < 0 || acl == nullptr) return EINVAL;
  if (static_cast<std::size_t>(count) > kACLMaxEntries) return ENOMEM;
  acl->entries.clear();
  acl->entries.reserve(static_cast<std::size_t>(count));
  return 0;
}

int ExtendedACL::createEntry(AccessControlList* acl, ACLEntryIndex* entry) {
  if (acl == nullptr || entry == nullptr) return EINVAL;
  if (acl->entries.size() >= kACLMaxEntries) return ENOMEM;
  acl->entries.emplace_back();
  *entry = acl->entries.size() - 1;
  return 0;
}

int ExtendedACL::getPermset(const AccessControlList& acl, ACLEntryIndex entry,
                            std::uint32_t* permset) {
  if (!validEntry(acl, entry) || permset == nullptr) return EINVAL;
  *permset = acl.entries[entry].permissions;
  return 0;
}

int ExtendedACL::addPerm(std::uint32_t* permset, std::uint32_t perm) {
  if (permset == nullptr || (perm & ~kACLAllPermissions) != 0) return EINVAL;
  *permset |= perm;
  return 0;
}

int ExtendedACL::setPermset(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t permset) {
  if (acl == nullptr || !validEntry(*acl, entry) || (permset & ~kACLAllPermissions) != 0) {
    return EINVAL;
  }
  acl->entries[entry].permissions = permset;
  return 0;
}

int ExtendedACL::getFlagset(const AccessControlList& acl, ACLEntryIndex entry,
                            std::uint32_t* flagset) {
  if (!validEntry(acl, entry) || flagset == nullptr) return EINVAL;
  *flagset = acl.entries[entry].flags;
  return 0;
}

int ExtendedACL::addFlag(std::uint32_t* flagset, std::uint32_t flag) {
  if (flagset == nullptr || (flag & ~kACLAllFlags) != 0) return EINVAL;
  *flagset |= flag;
  return 0;
}

int ExtendedACL::setFlagset(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t flagset) {
  if (acl == nullptr || !validEntry(*acl, entry) || (flagset & ~kACLAllFlags) != 0) return EINVAL;
  acl->entries[entry].flags = flagset;
  return 0;
}

int ExtendedACL::setTagType(AccessControlList* acl, ACLEntryIndex entry, std::uint32_t tag) {
  if (acl == nullptr || !validEntry(*acl, entry)) return EINVAL;
  if (tag != kACLTagExtendedAllow && tag != kACLTagExtendedDeny) return EINVAL;
  acl->entries[entry].tag = tag;
  return 0;
}

int ExtendedACL::setQualifier(AccessControlList* acl, ACLEntryIndex entry, const Uuid& qualifier) {
  if (acl == nullptr || !validEntry(*acl, entry)) return EINVAL;
  acl->entries[entry].qualifier = qualifier;
  return 0;
}

}  // namespace kestrel::platform
