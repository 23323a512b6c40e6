// The notification centre over real datagram sockets in a temporary directory.
#include <sys/socket.h>
#include <sys/un.h>

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/linux/notify_center.h"
#include "test_files.h"

namespace brisvale::notify {
namespace {

namespace fs = std::filesystem;

struct NotifyCenterTest : ::testing::Test {
  size_t SocketCount() const {
    return static_cast<size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
  }
  // A datagram socket bound at `name` in the directory, as any other program could make.
  UniqueFd Bind(const std::string& name) const {
    UniqueFd fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s/%s", directory.c_str(), name.c_str());
    EXPECT_EQ(::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0) << name;
    return fd;
  }

  const brisvale::testing::ScratchDir scratch;
  const std::string directory = scratch.str() + "/notify";
  std::unique_ptr<SystemNotify> center = CreateLinuxSystemNotify(directory);
};

// Subscribers and sockets of any other name get the post; what is not a socket there
// is passed over.
TEST_F(NotifyCenterTest, EverySocketInTheDirectoryGetsThePostWithItsUserInfo) {
  std::string error;
  auto first = Subscriber::Create(directory, &error);
  auto second = Subscriber::Create(directory, &error);
  ASSERT_TRUE(first && second) << error;
  const UniqueFd foreign = Bind("conformance-123");
  fs::create_directory(directory + "/sub-directory");
  Notification posted = Named("com.vantrel.mobile.disk_image_mounted");
  posted.userInfo = plist::Dictionary{{"DiskImageType", "Developer"}};
  posted.distributed = true;
  center->Post(posted);
  for (Subscriber* subscriber : {first.get(), second.get()}) {
    std::optional<Notification> received = subscriber->Receive(std::chrono::seconds(1));
    ASSERT_TRUE(received);
    EXPECT_EQ(received->name, posted.name);
    EXPECT_EQ(received->object, plist::Value(posted.name));
    EXPECT_EQ(received->userInfo, posted.userInfo);
    EXPECT_TRUE(received->distributed);
  }
  char buffer[4096];
  EXPECT_GT(::recv(foreign.get(), buffer, sizeof buffer, MSG_DONTWAIT), 0);
}

TEST_F(NotifyCenterTest, DeadSubscribersAreRemovedSlowOnesKept) {
  std::string error;
  auto slow = Subscriber::Create(directory, &error);
  ASSERT_TRUE(slow) << error;
  Bind("sub-dead");  // died without unlinking its name: a socket nobody reads
  ASSERT_EQ(SocketCount(), 2u);
  // Far more posts than a datagram queue holds: posting never blocks.
  for (int i = 0; i < 2000; ++i) center->Post(Named("com.vantrel.brisvale_unmounted"));
  EXPECT_EQ(SocketCount(), 1u);
  EXPECT_TRUE(slow->Receive(std::chrono::seconds(1)));
}

TEST(NotificationCodec, RejectsAMessageWithoutAName) {
  EXPECT_FALSE(DecodeNotification(plist::WriteBinary(plist::Dictionary{{"Object", "x"}})));
}

}  // namespace
}  // namespace brisvale::notify
