// Message IPC: typed request and reply dictionaries, the connection of one
// peer, and the listener of a named service that hands every request to a
// handler on a queue.
//
// Value types: uint64, int64, boolean, string (UTF-8), data (bytes), array,
// dictionary (string keys) and double. A UUID travels as data of exactly 16
// bytes: a reader asking for a UUID accepts data of that length only, a reader
// asking for data accepts any. Property-list values travel as the message value
// of the same shape (see plistToMessageValue).
//
// Reading a dictionary: a key that is absent, or holds a value of another
// type, reads as 0 (uint64, int64), false (boolean) or nothing (every other
// type). Integers are not converted between signed and unsigned.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/dispatch.h"
#include "platform/peer_credentials.h"
#include "platform/plist.h"
#include "platform/uuid.h"

namespace kestrel::platform {

class MessageValue;
using MessageArray = std::vector<MessageValue>;
using MessageData = std::vector<std::uint8_t>;

// What a received message may hold: containers nested deeper than this, or
// more bytes of content than this, are not read (the entry reads as absent).
inline constexpr std::size_t kMaxMessageDepth = 64;
inline constexpr std::size_t kMaxMessageBytes = std::size_t{16} << 20;  // 16 MiB

class MessageDictionary {
 public:
  using Entries = std::map<std::string, MessageValue, std::less<>>;

  // Typed reads; see the top of this file for absent and wrong-typed keys.
  std::uint64_t uint64(std::string_view key) const;
  std::int64_t int64(std::string_view key) const;
  bool boolean(std::string_view key) const;
  std::optional<std::string> string(std::string_view key) const;
  std::optional<Uuid> uuid(std::string_view key) const;
  std::optional<MessageData> data(std::string_view key) const;
  std::optional<double> real(std::string_view key) const;
  const MessageArray* array(std::string_view key) const;
  const MessageDictionary* dictionary(std::string_view key) const;
  // The value of any type, as a property-list object.
  std::optional<PlistValue> plist(std::string_view key) const;
  // The value whatever its type; nullptr when absent.
  const MessageValue* value(std::string_view key) const;
  bool contains(std::string_view key) const;

  void setUint64(std::string key, std::uint64_t value);
  void setInt64(std::string key, std::int64_t value);
  void setBoolean(std::string key, bool value);
  void setString(std::string key, std::string value);
  void setUuid(std::string key, const Uuid& value);
  void setData(std::string key, MessageData value);
  void setReal(std::string key, double value);
  void setArray(std::string key, MessageArray value);
  void setDictionary(std::string key, MessageDictionary value);
  // False (and nothing set) when the value is nested too deep to travel.
  bool setPlist(std::string key, const PlistValue& value);
  void set(std::string key, MessageValue value);
  void remove(std::string_view key);

  const Entries& entries() const { return entries_; }
  std::size_t size() const;
  bool empty() const;

  // Nothing when a value is nested deeper than kMaxMessageDepth.
  std::optional<PlistDictionary> toPlist() const;
  static std::optional<MessageDictionary> fromPlist(const PlistDictionary& dictionary);

  // A readable rendering for log messages ("%@").
  std::string description() const;

  friend bool operator==(const MessageDictionary& a, const MessageDictionary& b);

 private:
  Entries entries_;
};

class MessageValue {
 public:
  enum class Type { Uint64, Int64, Boolean, String, Data, Array, Dictionary, Double };

  // An unsigned zero.
  MessageValue() : value_(std::uint64_t{0}) {}

  static MessageValue fromUint64(std::uint64_t v) { return MessageValue(Storage(v)); }
  static MessageValue fromInt64(std::int64_t v) { return MessageValue(Storage(v)); }
  static MessageValue fromBoolean(bool v) { return MessageValue(Storage(v)); }
  static MessageValue fromString(std::string v) { return MessageValue(Storage(std::move(v))); }
  static MessageValue fromData(MessageData v) { return MessageValue(Storage(std::move(v))); }
  static MessageValue fromUuid(const Uuid& v);
  static MessageValue fromArray(MessageArray v) { return MessageValue(Storage(std::move(v))); }
  static MessageValue fromDictionary(MessageDictionary v) {
    return MessageValue(Storage(std::move(v)));
  }
  static MessageValue fromReal(double v) { return MessageValue(Storage(v)); }

  Type type() const { return static_cast<Type>(value_.index()); }

  // Typed access: nothing (or nullptr) when the value has another type.
  std::optional<std::uint64_t> uint64() const;
  std::optional<std::int64_t> int64() const;
  std::optional<bool> boolean() const;
  const std::string* string() const { return std::get_if<std::string>(&value_); }
  const MessageData* data() const { return std::get_if<MessageData>(&value_); }
  // Data of exactly 16 bytes.
  std::optional<Uuid> uuid() const;
  const MessageArray* array() const { return std::get_if<MessageArray>(&value_); }
  const MessageDictionary* dictionary() const { return std::get_if<MessageDictionary>(&value_); }
  std::optional<double> real() const;

  std::string description() const;

  friend bool operator==(const MessageValue&, const MessageValue&) = default;

 private:
  using Storage = std::variant<std::uint64_t, std::int64_t, bool, std::string, MessageData,
                               MessageArray, MessageDictionary, double>;
  explicit MessageValue(Storage value) : value_(std::move(value)) {}

  Storage value_;
};

// Property lists and message values.
//
//  message -> property list: uint64 -> unsigned integer, int64 -> integer,
//  boolean, string, data (a UUID too: 16 bytes of data), array, dictionary,
//  double -> real.
//  property list -> message: the reverse; a date becomes a double holding its
//  seconds since 2001-01-01 00:00:00 UTC, and so comes back as a real.
//
// Both directions give nothing for a value nested deeper than kMaxMessageDepth.
std::optional<PlistValue> messageValueToPlist(const MessageValue& value);
std::optional<MessageValue> plistToMessageValue(const PlistValue& value);

class MessageConnection;

// What a connection needs to answer one request. Each implementation keeps
// its own; a request without one expects no reply.
class MessageReplyContext {
 public:
  virtual ~MessageReplyContext() = default;
};

class ReceivedMessage {
 public:
  ReceivedMessage(MessageDictionary dictionary, std::shared_ptr<MessageReplyContext> replyContext,
                  std::shared_ptr<MessageConnection> remoteConnection);

  const MessageDictionary& dictionary() const { return dictionary_; }
  // False for a message whose sender expects no reply.
  bool hasReplyContext() const { return replyContext_ != nullptr; }
  // An empty reply dictionary; nothing when the request has no reply context.
  std::optional<MessageDictionary> makeReply() const;
  // The connection the message came in on.
  const std::shared_ptr<MessageConnection>& remoteConnection() const { return remoteConnection_; }
  const std::shared_ptr<MessageReplyContext>& replyContext() const { return replyContext_; }

 private:
  MessageDictionary dictionary_;
  std::shared_ptr<MessageReplyContext> replyContext_;
  std::shared_ptr<MessageConnection> remoteConnection_;
};

// One peer. Its identity was taken when it connected. Every member function
// may be called from any thread.
class MessageConnection {
 public:
  virtual ~MessageConnection() = default;

  // The peer's identity as the kernel recorded it (the audit token).
  virtual const PeerCredentials& peerCredentials() const = 0;
  pid_t pid() const { return peerCredentials().pid; }
  uid_t effectiveUserId() const { return peerCredentials().uid; }

  // Closes the connection; nothing more is sent or received on it.
  virtual void cancel() = 0;
  // Sends the reply to a request that came in on this connection, now or
  // later, from any thread. False when the request has no reply context of
  // this connection, was answered already, or the connection is gone.
  virtual bool sendReply(const ReceivedMessage& request, MessageDictionary reply) = 0;
};

// Called once per received message, on the listener's queue. Messages of one
// connection are handled one after the other, in the order they arrived;
// those of different connections in parallel (the queue permitting).
using MessageHandler = std::function<void(std::shared_ptr<MessageConnection>, ReceivedMessage)>;

// Destroying the listener stops it and closes its connections.
class MessageListener {
 public:
  virtual ~MessageListener() = default;
  virtual const std::string& serviceName() const = 0;
  // Starts accepting connections and delivering messages (once; later calls do nothing).
  virtual void resume() = 0;
};

class MessageIPC {
 public:
  virtual ~MessageIPC() = default;
  // A listener for the named service, suspended until resume(). nullptr, with
  // an error text, when the service cannot be offered.
  virtual std::shared_ptr<MessageListener> createListener(const std::string& serviceName,
                                                          std::shared_ptr<DispatchQueue> queue,
                                                          MessageHandler handler,
                                                          std::string* errorText) = 0;
};

}  // namespace kestrel::platform
