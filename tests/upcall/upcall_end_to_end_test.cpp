// The process-containers question through the real daemon's upcall socket,
// asked with kestrelctl as a sandbox launcher would, by root and by others.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "platform/linux/upcall_client_linux.h"
#include "support/registered_clients.h"
#include "support/upcall_requests.h"
#include "upcall/upcall_messages.h"

namespace kestrel {
namespace {

using testing::UpcallItem;
using Strings = std::vector<std::string>;

// kestrelctl's JSON, without what it wrote to standard error after it.
nlohmann::json replyOf(const testing::ProcessResult& result) {
  const std::size_t end = result.output.find("kestrelctl:");
  return nlohmann::json::parse(result.output.substr(0, end), nullptr, false);
}

std::vector<int> valueTypes(const nlohmann::json& reply) {
  std::vector<int> types;
  for (const auto& item : reply.value("Items", nlohmann::json::array())) {
    types.push_back(item["ValueType"]);
  }
  return types;
}

class UpcallEndToEndTest : public testing::RegisteredClientsTest {
 protected:
  std::string socket() const {
    return platform::upcallSocketPath(scratch.root(), "com.zorvane.kestreld.upcall");
  }
};

TEST_F(UpcallEndToEndTest, ProcessesGetTheirContainersInOrder) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  // A widget whose code-signing entry names the application data class.
  ASSERT_EQ(
      call("allowed-client", {"18", "Identifier=str:com.example.widget", "CodeSigningInfo=plist:{}",
                              "OptionsDictionary=plist:{\"com.zorvane.Kestrel."
                              "DataContainerClass\":2}"})
          .exitStatus,
      0);
  const std::string mobile = scratch.resolve("/private/var/mobile");
  const std::string app = "--signing-identifier=com.example.app";

  struct Row {
    const char* name;
    Strings arguments;
    int exitStatus;
    std::vector<int> valueTypes;
    const char* dataClass;  // the directory the data container lies in, if any
    const char* logged;
  };
  const Row rows[] = {
      {"a signing identifier alone",
       {app, "--persona=501"},
       0,
       {100, 1, 2, 0},
       "/Data/Application/",
       nullptr},
      {"no identifier", {"--persona=501"}, 0, {100, 0}, nullptr, nullptr},
      {"every kind",
       {app, "--container-identifier=com.example.app.data", "--persona=501", "--group=group.b",
        "--group=group.a", "--system-container=com.example.daemon",
        "--system-group=systemgroup.com.example.logs"},
       0,
       {100, 1, 2, 3, 4, 3, 4, 101, 102, 103, 0},
       "/Data/Application/",
       nullptr},
      {"a plug-in the code signing calls an app",
       {"--signing-identifier=com.example.widget", "--plugin", "--persona=501"},
       0,
       {100, 1, 2, 0},
       "/Data/VantlerPlugin/",
       "SB Type: 1, TS Type: 2.  Declaring this a plugin"},
      {"a plug-in without code-signing information",
       {"--signing-identifier=com.example.other", "--plugin", "--persona=501"},
       0,
       {100, 1, 2, 0},
       "/Data/VantlerPlugin/",
       "SB Type: 1, falling back to class: 4"},
      {"one group that cannot be made",
       {app, "--persona=501", "--group=group.a", "--group=bad/group"},
       1,
       {0},
       nullptr,
       "createOrLookupGroupContainersForUser: Failed with error: 11"},
      {"user 0", {}, 0, {100, 0}, nullptr, nullptr},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.name);
    Strings arguments = {"--json", "upcall"};
    arguments.insert(arguments.end(), row.arguments.begin(), row.arguments.end());
    const testing::ProcessResult result = ctl("plain-client", arguments);
    EXPECT_EQ(result.exitStatus, row.exitStatus) << result.output;
    const nlohmann::json reply = replyOf(result);
    EXPECT_EQ(reply.value("ReturnCode", -1), 0) << result.output;
    EXPECT_EQ(valueTypes(reply), row.valueTypes) << result.output;
    EXPECT_EQ(reply.value("Status", 2), row.exitStatus == 0 ? 1 : 0);
    if (row.dataClass) {
      const std::string data = reply.value("DataContainer", "");
      EXPECT_NE(data.find(mobile + "/Containers" + row.dataClass), std::string::npos) << data;
      EXPECT_EQ(reply.value("TemporaryDirectory", ""), data + "/tmp");
    }
    if (row.valueTypes.size() > 1) {
      EXPECT_EQ(
          reply.value("HomeDirectory", ""),
          scratch.resolve(row.arguments.empty() ? "/private/var/root" : "/private/var/mobile"));
    }
    if (row.logged) {
      EXPECT_NE(log().find(row.logged), std::string::npos);
    }
  }
}

TEST_F(UpcallEndToEndTest, OnlyRootReachesTheSocketAndOnlyTheKernelIsAnswered) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  struct stat st = {};
  ASSERT_EQ(::stat(socket().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_gid, 0u);

  const Strings asUser = {"--reuid=501", "--regid=501", "--clear-groups"};
  const Strings upcall = {KESTRELCTL_BINARY, "--root", scratch.path(),
                          "--json",          "upcall", "--signing-identifier=com.example.app",
                          "--persona=501"};
  Strings refused = asUser;
  refused.insert(refused.end(), upcall.begin(), upcall.end());
  const auto denied = testing::runProcess("/usr/bin/setpriv", refused);
  EXPECT_EQ(denied.exitStatus, 3) << denied.output;
  EXPECT_NE(denied.output.find("Permission denied"), std::string::npos) << denied.output;

  // Allowed past the file's mode, a user's process reaches the server, which
  // answers only the kernel.
  Strings overriding = asUser;
  overriding.insert(overriding.end(), {"--inh-caps=+dac_override", "--ambient-caps=+dac_override"});
  overriding.insert(overriding.end(), upcall.begin(), upcall.end());
  const auto user = testing::runProcess("/usr/bin/setpriv", overriding);
  EXPECT_EQ(user.exitStatus, 1) << user.output;
  EXPECT_EQ(replyOf(user).value("ReturnCode", -1), 5) << user.output;

  const auto unknown = ctl("plain-client", {"upcall", "--persona=501", "--item=8=u32:1"});
  EXPECT_EQ(unknown.exitStatus, 1) << unknown.output;
  EXPECT_EQ(unknown.output, "kestrelctl: upcall failed: return code 4 (unknown request item)\n");
}

// A datagram that is no message costs its sender the connection, a sender
// that does not read its replies is dropped after a bounded wait, and the
// server goes on answering others.
TEST_F(UpcallEndToEndTest, MisbehavingPeersDoNotStopTheServer) {
  testing::DaemonProcess daemon(scratch.path());
  ASSERT_TRUE(daemon.ready());
  const std::vector<std::uint8_t> request = testing::upcallRequest({UpcallItem::number(3, 501)});
  const auto answered = [&] {
    auto client = platform::UpcallClient::connect(socket(), nullptr);
    if (!client) return false;
    const auto outcome = client->call(request, std::chrono::seconds(10));
    std::string error;
    const auto reply = KSTUpcallParseReply(outcome.reply, &error);
    return outcome.status == platform::UpcallClient::Status::Reply && reply &&
           reply->returnCode == 0;
  };

  auto shortOne = platform::UpcallClient::connect(socket(), nullptr);
  ASSERT_TRUE(shortOne);
  const std::vector<std::uint8_t> tooShort(12, 0);
  EXPECT_EQ(shortOne->call(tooShort, std::chrono::seconds(10)).status,
            platform::UpcallClient::Status::Closed);
  EXPECT_TRUE(answered());

  auto deaf = platform::UpcallClient::connect(socket(), nullptr);
  ASSERT_TRUE(deaf);
  // Its sends go on until the server, its replies piled up, drops it.
  while (deaf->send(request, nullptr)) {
  }
  EXPECT_TRUE(answered());
  EXPECT_NE(log().find("the peer does not read its replies; connection closed"), std::string::npos);
  EXPECT_NE(log().find("a datagram of 12 bytes is shorter than a message header"),
            std::string::npos);
}

}  // namespace
}  // namespace kestrel
