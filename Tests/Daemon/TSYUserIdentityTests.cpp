#include "Daemon/TSYUserIdentity.h"

#include <gtest/gtest.h>

#include "Daemon/TSYUserIdentityCache.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::PersonaKind;
using platform::Value;

Value::Dictionary plist(Value version, Value uid, Value::Dictionary more = {}) {
  more.emplace("version", std::move(version));
  more.emplace("posixUID", uid);
  more.emplace("posixGID", std::move(uid));
  return more;
}

// What a metadata file names its owner with; it may have been written by anybody.
TEST(TSYUserIdentity, plistsNameIdentitiesOfTheCache) {
  const ContainerDevice device(FakePersonas::List{makePersona(PersonaKind::personal, 100, "P"),
                                                  makePersona(PersonaKind::enterprise, 200, "E")});
  TSYUserIdentityCache cache;
  const struct {
    const char* name;
    Value plist;
    std::string identity;  // with its uid and type, or a code
  } cases[] = {
      {"personal", plist("2", 501, {{"type", 0}}), "501 501 0"},
      {"unspecific comes back as personal", plist("2", 501, {{"type", 2}}), "501 501 0"},
      {"other user", plist("2", 502, {{"type", 0}}), "502 502 0"},
      {"role account", plist("2", 33, {{"type", 0}}), "501 501 0"},
      {"enterprise of another user", plist("2", 502, {{"type", 1}, {"personaUniqueString", "E"}}),
       "E 502 1"},
      {"said to be enterprise, but is not",
       plist("2", 501, {{"type", 1}, {"personaUniqueString", "P"}}), "501 501 0"},
      {"enterprise without a string", plist("2", 501, {{"type", 1}}), "501 501 0"},
      {"version 1", plist("1", 501), "501 501 0"},
      {"version 1 with a persona", plist("1", 501, {{"personaIdentifier", "E"}}), "E 501 1"},
      {"version 1, persona unknown", plist("1", 502, {{"personaIdentifier", "gone"}}), "502 502 0"},

      {"no dictionary", "2", "code 1"},
      {"version is a number", plist(2, 501, {{"type", 0}}), "code 1"},
      {"version 3", plist("3", 501, {{"type", 0}}), "code 1"},
      {"enterprise persona gone", plist("2", 501, {{"type", 1}, {"personaUniqueString", "gone"}}),
       "code 1"},
      {"uid is text", plist("2", "501", {{"type", 0}}), "code 75"},
      {"gid missing", Value::Dictionary{{"version", "1"}, {"posixUID", 501}}, "code 75"},
      {"uid beyond 32 bits", plist("1", int64_t{0x1000001f5}), "code 75"},
      {"negative uid", plist("1", -2), "code 75"},
      {"the uid that means none", plist("1", 0xffffffffU), "code 75"},
      {"type missing", plist("2", 501), "code 75"},
      {"type too large", plist("2", 501, {{"type", 3}}), "code 75"},
  };
  const auto text = [](const TSYResult<TSYUserIdentityRef>& identity) {
    if (!identity) return fmt::format("code {}", identity.error().code());
    return fmt::format("{} {} {}", (*identity)->identifier(), (*identity)->posixUID(),
                       static_cast<int>((*identity)->personaType()));
  };
  for (const auto& test : cases) {
    const auto identity = TSYUserIdentity::userIdentityWithPlist(test.plist, cache);
    EXPECT_EQ(text(identity), test.identity) << test.name;
    if (!identity) continue;
    EXPECT_EQ(text(TSYUserIdentity::userIdentityWithPlist((*identity)->plist(), cache)),
              test.identity)
        << test.name << ", written and read again";
  }
}

}  // namespace
