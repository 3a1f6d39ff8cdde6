#include "platform/PowerLog.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <fstream>
#include <map>
#include <optional>
#include <vector>

#include "foundation/Json.h"
#include "platform/FileDescriptor.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

/// What the journal has for a socket, read by a reader of the tests' own.
class JournalSocket {
 public:
  struct Entry {
    std::string bytes;
    bool cameAsDescriptor = false;
    int seals = 0;
  };

  explicit JournalSocket(const std::string& path) : _socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::bind(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }

  /// The next datagram; nothing when none is there. Senders have sent before they return, so there is no waiting.
  std::optional<Entry> take() {
    std::string buffer(1 << 20, '\0');
    iovec bytes{buffer.data(), buffer.size()};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message{};
    message.msg_iov = &bytes;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t size = ::recvmsg(_socket.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (size < 0) return std::nullopt;
    Entry entry{buffer.substr(0, static_cast<std::size_t>(size))};
    if (const cmsghdr* header = CMSG_FIRSTHDR(&message); header != nullptr && header->cmsg_type == SCM_RIGHTS) {
      EXPECT_EQ(size, 0) << "nothing beside the descriptor";
      int number = -1;
      std::memcpy(&number, CMSG_DATA(header), sizeof number);
      const FileDescriptor memory(number);
      entry.cameAsDescriptor = true;
      entry.seals = ::fcntl(memory.get(), F_GET_SEALS);
      std::string part(1 << 16, '\0');
      off_t offset = 0;
      for (ssize_t got; (got = ::pread(memory.get(), part.data(), part.size(), offset)) > 0; offset += got) {
        entry.bytes.append(part, 0, static_cast<std::size_t>(got));
      }
    }
    return entry;
  }

 private:
  FileDescriptor _socket;
};

/// The fields of an entry in the journal's native form. Fails on anything that is not whole.
std::multimap<std::string, std::string> fieldsOf(std::string_view bytes) {
  std::multimap<std::string, std::string> fields;
  while (!bytes.empty()) {
    const auto end = bytes.find('\n');
    if (end == std::string_view::npos) {
      ADD_FAILURE() << "a line without an end";
      return fields;
    }
    const auto line = bytes.substr(0, end);
    bytes.remove_prefix(end + 1);
    if (const auto equals = line.find('='); equals != std::string_view::npos) {
      fields.emplace(line.substr(0, equals), line.substr(equals + 1));
      continue;
    }
    std::uint64_t size = 0;
    for (int i = 7; i >= 0; --i) size = size << 8 | static_cast<unsigned char>(bytes.at(static_cast<std::size_t>(i)));
    fields.emplace(line, bytes.substr(8, size));
    bytes.remove_prefix(8 + size);
    EXPECT_EQ(bytes.at(0), '\n');
    bytes.remove_prefix(1);
  }
  return fields;
}

const std::vector<std::string> kFields{"MESSAGE",
                                       "MESSAGE_ID",
                                       "PRIORITY",
                                       "SYSLOG_IDENTIFIER",
                                       "VELKREPORTING_CLIENT",
                                       "VELKREPORTING_EVENT",
                                       "VELKREPORTING_PAYLOAD"};

class JournalPowerLogTest : public testing::Test {
 protected:
  [[nodiscard]] std::multimap<std::string, std::string> entryFor(const PropertyDictionary& event) {
    powerLog->logRegisteredEvent(28, "Orlenad-Velk", event);
    const auto entry = journal.take();
    EXPECT_TRUE(entry);
    auto fields = entry ? fieldsOf(entry->bytes) : std::multimap<std::string, std::string>();
    std::vector<std::string> names;
    for (const auto& [name, value] : fields) names.push_back(name);
    EXPECT_EQ(names, kFields) << "always these, each once";
    return fields;
  }

  const test::TemporaryDirectory directory;
  JournalSocket journal{directory / "journal"};
  const std::unique_ptr<PowerLog> powerLog = makeJournalPowerLog(directory / "journal");
};

TEST_F(JournalPowerLogTest, WritesOneEntryOfFixedFields) {
  const auto fields = entryFor({{"wakeups", 12}, {"method", 7}});
  EXPECT_EQ(fields.find("MESSAGE")->second, "Orlenad-Velk");
  EXPECT_EQ(fields.find("MESSAGE_ID")->second, kPowerLogMessageID);
  EXPECT_EQ(fields.find("PRIORITY")->second, "6");
  EXPECT_EQ(fields.find("SYSLOG_IDENTIFIER")->second, "velkreportingd");
  EXPECT_EQ(fields.find("VELKREPORTING_CLIENT")->second, "28");
  EXPECT_EQ(fields.find("VELKREPORTING_EVENT")->second, "Orlenad-Velk");
  EXPECT_EQ(fields.find("VELKREPORTING_PAYLOAD")->second, R"({"wakeups":12,"method":7})");
  EXPECT_FALSE(journal.take());
}

TEST_F(JournalPowerLogTest, KeepsHostileKeysAndTextWithinThePayload) {
  const std::string evil = "x\nMESSAGE=forged\nPRIORITY=0\r\x1b[31m\xc2\x85\xe2\x80\xa8";
  const PropertyDictionary event{{evil, evil}, {"MESSAGE", "mine"}, {"_PID", 1}, {"=", PropertyArray{evil}}};
  const auto fields = entryFor(event);
  const auto& payload = fields.find("VELKREPORTING_PAYLOAD")->second;
  EXPECT_EQ(payload.find_first_of("\n\r\x1b"), std::string::npos);
  EXPECT_EQ(payload.find("\xc2\x85"), std::string::npos);
  EXPECT_EQ(payload.find("\xe2\x80\xa8"), std::string::npos);
  EXPECT_EQ(json::parse(payload).value_or(PropertyValue()), PropertyValue(event));
  EXPECT_EQ(fields.find("MESSAGE")->second, "Orlenad-Velk");
}

TEST_F(JournalPowerLogTest, SendsWhatIsTooLargeAsSealedMemory) {
  const std::string large(3 * 1024 * 1024, 'y');
  powerLog->logRegisteredEvent(28, "Orlenad-Velk", {{"large", large}});
  const auto entry = journal.take();
  ASSERT_TRUE(entry);
  EXPECT_TRUE(entry->cameAsDescriptor);
  EXPECT_EQ(entry->seals & (F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL),
            F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL);
  const auto fields = fieldsOf(entry->bytes);
  EXPECT_EQ(fields.size(), kFields.size());
  EXPECT_EQ(fields.find("VELKREPORTING_PAYLOAD")->second, "{\"large\":\"" + large + "\"}");
  EXPECT_FALSE(journal.take());
}

TEST_F(JournalPowerLogTest, LosesEntriesThatNobodyTakes) {
  makeJournalPowerLog(directory / "nobody")->logRegisteredEvent(28, "Orlenad-Velk", {{"a", 1}});
  makeJournalPowerLog("/" + std::string(300, 'x'))->logRegisteredEvent(28, "Orlenad-Velk", {{"a", 1}});
  makeJournalPowerLog("")->logRegisteredEvent(28, "Orlenad-Velk", {{"a", 1}});
}

TEST_F(JournalPowerLogTest, DoesNotWaitForEverForAJournalThatHasFallenBehind) {
  int room = 0;
  std::ifstream("/proc/sys/net/unix/max_dgram_qlen") >> room;
  ASSERT_GT(room, 0);
  // Those beyond what a socket's queue holds are lost, each after a moment.
  for (int sent = 0; sent < room + 4; ++sent) powerLog->logRegisteredEvent(28, "Orlenad-Velk", {{"n", sent}});
  int taken = 0;
  while (journal.take()) ++taken;
  EXPECT_GE(taken, room);
  EXPECT_LT(taken, room + 4);
}

}  // namespace
}  // namespace velk
