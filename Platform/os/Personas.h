// The user-management service: which personas the user has.
//
// Abstract because tests need a service that is silent or changes at will. DevicePersonas is the
// real one: it reads etc/tessary/personas.plist and follows it with inotify.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace platform {

enum class PersonaKind { personal, enterprise, universal, system };

struct PersonaAttributes {
  std::optional<std::string> uniqueString;
  uint32_t personaID = 0;
  PersonaKind kind = PersonaKind::personal;
  std::optional<std::string> layoutPath;  // with the root in front
  std::vector<std::string> bundleIdentifiers;

  std::string description() const;
  bool operator==(const PersonaAttributes&) const = default;
};

class Personas {
 public:
  virtual ~Personas() = default;

  // Whether the device has personas at all: decided at start, the same for the process's life.
  virtual bool present() const = 0;
  // The last good list. Any thread.
  virtual std::vector<PersonaAttributes> list() const = 0;
  // Calls `listDidUpdate` on a thread of the service after each change. Returns an error text when
  // updates cannot be followed. `serviceName` names the observer in messages.
  virtual std::optional<std::string> observe(const std::string& serviceName,
                                             std::function<void()> listDidUpdate) = 0;
};

}  // namespace platform
