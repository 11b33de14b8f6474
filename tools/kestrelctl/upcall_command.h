// kestrelctl upcall: the sandbox's process-containers request, sent over the
// daemon's upcall socket as a sandbox launcher sends it, and its reply
// decoded for people or as JSON.
#pragma once

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace kestrel::kestrelctl {

struct UpcallRequestOptions {
  std::optional<std::string> signingIdentifier;
  std::optional<std::string> containerIdentifier;
  std::optional<std::string> applicationIdentifier;
  std::optional<std::uint32_t> persona;
  std::vector<std::string> groups;
  std::optional<std::string> systemContainer;
  std::vector<std::string> systemGroups;
  bool plugin = false;
  // Further items, "<value type>=u32:<number>" or "<value type>=str:<text>",
  // packed after the others in their order.
  std::vector<std::string> items;
};

// The request datagram: the identifiers given, the persona when given, the
// container type (1 with plugin, else 0), the groups, the system container,
// the system groups, then the further items. False, with a message, for an
// item that cannot be read.
bool buildUpcallRequest(const UpcallRequestOptions& options, std::vector<std::uint8_t>* datagram,
                        std::string* error);

struct UpcallReplyItem {
  std::uint16_t valueType = 0;
  std::optional<std::uint32_t> number;
  std::optional<std::string> text;
};

struct DecodedUpcallReply {
  std::int32_t returnCode = 0;
  std::vector<UpcallReplyItem> items;  // in their order
};

// Nothing, with the reason, for a datagram that is no reply or whose packed
// buffer cannot be read to its end.
std::optional<DecodedUpcallReply> decodeUpcallReply(std::span<const std::uint8_t> datagram,
                                                    std::string* error);

// Two columns: what each item is, and its path or value.
std::string renderUpcallReply(const DecodedUpcallReply& reply);
// {"ReturnCode", "Status", "HomeDirectory", "DataContainer", "TemporaryDirectory",
//  "Groups" {id: path}, "SystemContainer", "SystemGroups" {id: path}, "Items" [...]},
// each present only when the reply carries it.
nlohmann::json upcallReplyToJson(const DecodedUpcallReply& reply);

// The return code in words.
std::string upcallReturnCodeText(std::int32_t code);

}  // namespace kestrel::kestrelctl
