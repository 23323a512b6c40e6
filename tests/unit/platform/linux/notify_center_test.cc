// The notification centre over real datagram sockets in a temporary directory.
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/linux/notify_center.h"
#include "test_files.h"

namespace brisvale::notify {
namespace {

namespace fs = std::filesystem;

struct NotifyCenterTest : ::testing::Test {
  NotifyCenterTest() { center = CreateLinuxSystemNotify(directory + "/notify"); }

  size_t SocketCount() const {
    return static_cast<size_t>(std::distance(fs::directory_iterator(directory + "/notify"), fs::directory_iterator()));
  }

  const brisvale::testing::ScratchDir scratch;
  const std::string directory = scratch.str();
  std::unique_ptr<SystemNotify> center;
};

TEST_F(NotifyCenterTest, EverySubscriberGetsThePostWithItsUserInfo) {
  std::string error;
  auto first = Subscriber::Create(directory + "/notify", &error);
  auto second = Subscriber::Create(directory + "/notify", &error);
  ASSERT_TRUE(first && second) << error;
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
}

// Any datagram socket in the directory subscribes, whatever its name; what is not a
// socket there is passed over.
TEST_F(NotifyCenterTest, SocketsOfAnyNameGetThePost) {
  std::vector<int> sockets;
  for (const char* name : {"mine", "x.sock", "conformance-123"}) {
    const int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s/notify/%s", directory.c_str(), name);
    ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0) << name;
    sockets.push_back(fd);
  }
  fs::create_directory(directory + "/notify/sub-directory");
  center->Post(Named("com.vantrel.brisvale_mounted"));
  for (const int fd : sockets) {
    char buffer[4096];
    const ssize_t received = ::recv(fd, buffer, sizeof buffer, MSG_DONTWAIT);
    ASSERT_GT(received, 0);
    const auto notification = DecodeNotification({reinterpret_cast<uint8_t*>(buffer), static_cast<size_t>(received)});
    EXPECT_EQ(notification ? notification->name : "", "com.vantrel.brisvale_mounted");
    ::close(fd);
  }
}

TEST_F(NotifyCenterTest, DeadSubscribersAreRemovedSlowOnesKept) {
  std::string error;
  auto slow = Subscriber::Create(directory + "/notify", &error);
  ASSERT_TRUE(slow) << error;
  {
    // A subscriber that died without unlinking its name leaves a socket nobody reads.
    const int orphan = ::socket(AF_UNIX, SOCK_DGRAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = directory + "/notify/sub-dead";
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    ASSERT_EQ(::bind(orphan, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ::close(orphan);
  }
  ASSERT_EQ(SocketCount(), 2u);
  // Far more posts than a datagram queue holds: posting never blocks.
  for (int i = 0; i < 2000; ++i) center->Post(Named("com.vantrel.brisvale_unmounted"));
  EXPECT_EQ(SocketCount(), 1u);
  EXPECT_TRUE(slow->Receive(std::chrono::seconds(1)));
}

TEST(NotificationCodec, RejectsWhatIsNotANotification) {
  EXPECT_FALSE(DecodeNotification(plist::WriteBinary(plist::Dictionary{{"Object", "x"}})));
  const plist::Bytes garbage = {'b', 'p', 'l', 'i', 's', 't'};
  EXPECT_FALSE(DecodeNotification(garbage));
}

}  // namespace
}  // namespace brisvale::notify
