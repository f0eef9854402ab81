#include "Daemon/TSYClientConnection.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>

#include <future>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using testing::IsEmpty;

const std::string kCaches = "/private/var/root/Library/Caches/com.veltra.tessaryd";
const std::string kDeathRow = kCaches + "/Dead";

uint64_t emptyDeathRow() {
  std::promise<uint64_t> code;
  TSYClientConnection::deleteContainersOnDeathRowWithCompletion(
      [&](uint64_t result) { code.set_value(result); });
  return code.get_future().get();
}

TEST(TSYClientConnection, whatGoesToDeathRowKeepsItsNameAndIsEmptiedLater) {
  const ContainerDevice device;
  device.write("/one/same/inside/file", "1");
  device.write("/two/same", "2");
  device.write("/victim/file", "3");
  std::filesystem::create_symlink(device.path("/victim"), device.path("/three"));
  for (const char* item : {"/one/same", "/two/same", "/three", "/missing"}) {
    EXPECT_TRUE(TSYClientConnection::_moveItemAtURLToDeathRow(TSYURL(device.path(item)),
                                                              /*startDeletionThread=*/false)
                    .has_value())
        << item;
    EXPECT_FALSE(std::filesystem::exists(device.path(item)));
  }
  EXPECT_EQ(device.namesIn(kDeathRow).size(), 4U) << "each in a directory of its own";
  EXPECT_EQ(emptyDeathRow(), 1U);
  EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty());
  EXPECT_EQ(device.read("/victim/file"), "3");
  std::filesystem::remove_all(device.path(kCaches));
  EXPECT_EQ(emptyDeathRow(), 1U);

  std::filesystem::remove_all(device.path(kCaches));
  device.write(kDeathRow, "in the way");
  EXPECT_EQ(emptyDeathRow(), 28U);
  expectFailure(TSYClientConnection::_moveItemAtURLToDeathRow(TSYURL(device.path("/victim")),
                                                              /*startDeletionThread=*/false),
                41, "Failed to create unique directory at: " + device.path("/victim"));
}

TEST(TSYClientConnection, whatCannotBeRemovedIsMovedOutOfDeathRow) {
  const ContainerDevice device;
  device.write(kDeathRow + "/item/stubborn/file", "");
  device.write(kDeathRow + "/other/file", "");
  const auto setFlags = [](const std::string& directory, int flags) {
    const platform::FileDescriptor descriptor(::open(directory.c_str(), O_RDONLY | O_DIRECTORY));
    return ::ioctl(descriptor.get(), FS_IOC_SETFLAGS, &flags) == 0;
  };
  // Nothing can be taken out of a directory that can only be added to.
  if (!setFlags(device.path(kDeathRow + "/item/stubborn"), FS_APPEND_FL)) {
    GTEST_SKIP() << "the file system has no such flag";
  }
  EXPECT_EQ(emptyDeathRow(), 17U) << "there is no /tmp";
  EXPECT_THAT(device.namesIn(kDeathRow), testing::ElementsAre("item"));
  EXPECT_EQ(device.countInLog("Failed to destroy item at: " + device.path(kDeathRow + "/item")),
            1U);
  std::filesystem::create_directory(device.path("/tmp"));
  EXPECT_EQ(emptyDeathRow(), 1U);
  EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty());
  EXPECT_EQ(device.namesIn("/tmp/item/stubborn").size(), 1U);
  setFlags(device.path("/tmp/item/stubborn"), 0);
}

}  // namespace
