#include "Platform/fs/AccessControl.h"

#include <fcntl.h>

#include "Tests/Platform/fs/Scratch.h"

namespace platform {
namespace {

constexpr gid_t kGroup = 54321;  // of no name: shown as its number
constexpr char kTopLevel[] = "user::rwx,group::r-x,group:54321:rwx,mask::rwx,other::r-x,";
constexpr char kInner[] = "user::---,group::---,group:54321:rwx,mask::rwx,other::---,";
constexpr char kDefault[] = "user::rwx,group::---,group:54321:rwx,mask::rwx,other::---,";

class AccessControlTest : public testing::Test {
 protected:
  void SetUp() override {
    std::filesystem::create_directory(scratch_.path("d"));
    scratch_.write(scratch_.path("f"), "");
    std::filesystem::create_symlink("f", scratch_.path("link"));
    parent_ = FileDescriptor(::open(scratch_.path("").c_str(), O_PATH));
  }

  Scratch scratch_;
  FileDescriptor parent_;
};

TEST_F(AccessControlTest, SetsThreeShapes) {
  const std::string directory = scratch_.path("d");
  ASSERT_TRUE(setACL(parent_.get(), "d", ACLShape::topLevelDirectory, kGroup));
  EXPECT_EQ(aclText(directory, ACL_TYPE_ACCESS), kTopLevel);
  EXPECT_EQ(aclText(directory, ACL_TYPE_DEFAULT), kDefault);
  ASSERT_TRUE(setACL(parent_.get(), "d", ACLShape::directory, kGroup));
  EXPECT_EQ(aclText(directory, ACL_TYPE_ACCESS), kInner);
  EXPECT_EQ(aclText(directory, ACL_TYPE_DEFAULT), kDefault);
  EXPECT_EQ(Scratch::mode(directory), 0070U);
  ASSERT_TRUE(setACL(parent_.get(), "f", ACLShape::file, kGroup));
  EXPECT_EQ(aclText(scratch_.path("f"), ACL_TYPE_ACCESS), kInner);
}

TEST_F(AccessControlTest, RefusesWhatTheShapeIsNotFor) {
  struct Case {
    const char* name;
    ACLShape shape;
    int error;
  };
  for (const Case& refused :
       {Case{"link", ACLShape::file, ELOOP}, Case{"d", ACLShape::file, EISDIR},
        Case{"f", ACLShape::directory, ENOTDIR}, Case{"x", ACLShape::file, ENOENT}}) {
    const auto set = setACL(parent_.get(), refused.name, refused.shape, kGroup);
    ASSERT_FALSE(set) << refused.name;
    EXPECT_EQ(set.error().error.value, refused.error) << refused.name;
    EXPECT_EQ(set.error().call, "") << refused.name;
  }
  EXPECT_EQ(aclText(scratch_.path("f"), ACL_TYPE_ACCESS), "user::rw-,group::r--,other::r--,");
}

TEST_F(AccessControlTest, IsInheritedByDirectoriesWhateverTheirMode) {
  const mode_t before = ::umask(0);
  ASSERT_TRUE(setACL(parent_.get(), "d", ACLShape::topLevelDirectory, kGroup));
  ASSERT_TRUE(scratch_.files().makePath(scratch_.path("d/e/f"), 0));
  const bool hasMode0 = scratch_.files().privilege() == Privilege::root;
  for (const char* made : {"d/e", "d/e/f"}) {
    const std::string expected = hasMode0 ? kInner : kDefault;
    EXPECT_EQ(aclText(scratch_.path(made), ACL_TYPE_ACCESS), expected) << made;
    EXPECT_EQ(aclText(scratch_.path(made), ACL_TYPE_DEFAULT), kDefault) << made;
  }
  ::umask(before);
}

}  // namespace
}  // namespace platform
