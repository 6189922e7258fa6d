// Properties on the bus: the read-only and writable properties of one interface at one object
// path, answered by sd-bus for org.freedesktop.DBus.Properties (Get, GetAll, Set) and announced
// with PropertiesChanged. Getters and setters run on the bus thread and must not block; values
// that other threads change are read from atomics or snapshots. Only root may write: a Set from
// any other user is refused with AccessDenied before the setter runs (the bus policy should
// refuse it first; this check holds where the policy is missing or too wide).
#pragma once

#include <systemd/sd-bus.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/bus/handles.h"
#include "platform/bus/messaging.h"
#include "platform/values/result.h"

namespace platform {

// What the EmitsChangedSignal annotation says of a property: PropertiesChanged carries its value
// (Emits), it never changes (Const), or watchers must poll it (None: it changes too often for a
// signal to be cheap).
enum class PropertyChanges { Emits, Const, None };

struct BusProperty {
  std::string name;
  std::string signature;  // one complete type
  // Appends the value to `reply`; a negative errno fails the read.
  std::function<int(sd_bus_message* reply)> get;
  // Reads the new value from `value` and applies it; an error refuses the write. Empty for a
  // read-only property.
  std::function<std::optional<BusError>(sd_bus_message* value)> set;
  PropertyChanges changes = PropertyChanges::Emits;
};

struct PropertyInterface {
  std::string path;
  std::string name;
  std::vector<BusProperty> properties;
};

class BusProperties {
 public:
  // exportOn registers every interface's properties on `bus` (bus thread). It returns the
  // registration, which lasts until the object is destroyed, or why sd-bus refused it.
  static Result<std::unique_ptr<BusProperties>> exportOn(sd_bus* bus, std::vector<PropertyInterface> interfaces);

  // changed sends PropertiesChanged with the current values of the named properties of the
  // interface at `path` (bus thread). A failure to send is logged and otherwise ignored.
  void changed(const std::string& path, const std::string& interface, const std::vector<std::string>& names);

  BusProperties(const BusProperties&) = delete;
  BusProperties& operator=(const BusProperties&) = delete;
  ~BusProperties();

  struct Registered;  // one interface's vtable and slot; defined where it is used

 private:
  BusProperties() = default;
  sd_bus* bus_ = nullptr;
  // sd-bus keeps pointers into these until the slots go, so they are released after them.
  std::vector<std::unique_ptr<Registered>> registered_;
};

}  // namespace platform
