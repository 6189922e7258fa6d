#include "platform/listener/bus_properties.h"

#include <cstring>

#include "platform/log/log.h"

namespace platform {

struct BusProperties::Registered {
  PropertyInterface interface;
  std::vector<sd_bus_vtable> vtable;
  BusSlotPtr slot;  // last: released first, before what it points into

  const BusProperty* find(const char* name) const {
    for (const BusProperty& p : interface.properties)
      if (p.name == name) return &p;
    return nullptr;
  }
};

namespace {

using Registered = BusProperties::Registered;

int getProperty(sd_bus*, const char*, const char*, const char* property, sd_bus_message* reply, void* userdata,
                sd_bus_error* error) noexcept {
  try {
    const BusProperty* p = static_cast<Registered*>(userdata)->find(property);
    return p ? p->get(reply) : sd_bus_error_set(error, "org.freedesktop.DBus.Error.UnknownProperty", property);
  } catch (const std::exception& e) {
    return sd_bus_error_set(error, kBusErrorFailed, e.what());
  }
}

// Writes come from root alone: the uid is the one the bus recorded for the caller's connection.
bool senderIsRoot(sd_bus_message* m) {
  sd_bus_creds* raw = nullptr;
  if (!m || sd_bus_query_sender_creds(m, SD_BUS_CREDS_EUID | SD_BUS_CREDS_UID, &raw) < 0) return false;
  std::unique_ptr<sd_bus_creds, HandleReleaser<sd_bus_creds, sd_bus_creds_unref>> creds(raw);
  uid_t uid = static_cast<uid_t>(-1);
  if (sd_bus_creds_get_euid(creds.get(), &uid) < 0 && sd_bus_creds_get_uid(creds.get(), &uid) < 0) return false;
  return uid == 0;
}

int setProperty(sd_bus* bus, const char*, const char*, const char* property, sd_bus_message* value, void* userdata,
                sd_bus_error* error) noexcept {
  try {
    const BusProperty* p = static_cast<Registered*>(userdata)->find(property);
    if (!p || !p->set) return sd_bus_error_set(error, "org.freedesktop.DBus.Error.PropertyReadOnly", property);
    if (!senderIsRoot(sd_bus_get_current_message(bus)))
      return sd_bus_error_setf(error, kBusErrorAccessDenied, "Only root may change %s.", property);
    if (std::optional<BusError> refused = p->set(value))
      return sd_bus_error_set(error, refused->name.c_str(), refused->message.c_str());
    return 0;
  } catch (const std::exception& e) {
    return sd_bus_error_set(error, kBusErrorFailed, e.what());
  }
}

sd_bus_vtable entry(const BusProperty& p) {
  sd_bus_vtable v{};
  v.type = p.set ? _SD_BUS_VTABLE_WRITABLE_PROPERTY : _SD_BUS_VTABLE_PROPERTY;
  // sd-bus would let the daemon's own user write too; the setter admits root alone.
  v.flags = p.set ? uint64_t{SD_BUS_VTABLE_UNPRIVILEGED} : uint64_t{0};
  if (p.changes == PropertyChanges::Emits) v.flags |= SD_BUS_VTABLE_PROPERTY_EMITS_CHANGE;
  if (p.changes == PropertyChanges::Const) v.flags |= SD_BUS_VTABLE_PROPERTY_CONST;
  v.x.property.member = p.name.c_str();
  v.x.property.signature = p.signature.c_str();
  v.x.property.get = &getProperty;
  v.x.property.set = p.set ? &setProperty : nullptr;
  v.x.property.offset = 0;
  return v;
}

}  // namespace

Result<std::unique_ptr<BusProperties>> BusProperties::exportOn(sd_bus* bus, std::vector<PropertyInterface> interfaces) {
  std::unique_ptr<BusProperties> made(new BusProperties());
  made->bus_ = bus;
  for (PropertyInterface& interface : interfaces) {
    auto r = std::make_unique<Registered>();
    r->interface = std::move(interface);
    sd_bus_vtable start{};
    start.type = _SD_BUS_VTABLE_START;
    start.x.start.element_size = sizeof(sd_bus_vtable);
    start.x.start.vtable_format_reference = &sd_bus_object_vtable_format;
    r->vtable.push_back(start);
    for (const BusProperty& p : r->interface.properties) r->vtable.push_back(entry(p));
    sd_bus_vtable end{};
    end.type = _SD_BUS_VTABLE_END;
    r->vtable.push_back(end);
    sd_bus_slot* slot = nullptr;
    int rc = sd_bus_add_object_vtable(bus, &slot, r->interface.path.c_str(), r->interface.name.c_str(),
                                      r->vtable.data(), r.get());
    if (rc < 0)
      return Failure{"cannot export the properties of " + r->interface.name + ": " + std::string(strerror(-rc))};
    r->slot.reset(slot);
    made->registered_.push_back(std::move(r));
  }
  return made;
}

BusProperties::~BusProperties() {
  // Slots first: sd-bus must stop calling into an interface before it goes.
  for (auto& r : registered_) r->slot.reset();
}

void BusProperties::changed(const std::string& path, const std::string& interface,
                            const std::vector<std::string>& names) {
  std::vector<const char*> list;
  for (const std::string& n : names) list.push_back(n.c_str());
  list.push_back(nullptr);
  int rc = sd_bus_emit_properties_changed_strv(bus_, path.c_str(), interface.c_str(), const_cast<char**>(list.data()));
  if (rc < 0) log(LogLevel::Error, "Cannot announce a change of %s: %s", interface, std::string(strerror(-rc)));
}

}  // namespace platform
