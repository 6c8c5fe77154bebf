// The storage controller's user client, answering from controller.plist.
//
// Tunnel commands arrive as a 24-byte little-endian record (command code,
// phase flags, index, size hint, buffer address). Phase flag bit 0 is the
// size phase; bits 2 to 9 carry a mode some lists are asked in. The size
// phase answers the buffer's length as 4 bytes, the data phase the bytes.
#include <cstring>
#include <map>

#include "sim/device.h"
#include "sim/statistics_buffers.h"
#include "sim/storage_lists.h"
#include "sim/user_clients.h"

namespace sim {

namespace {

// The controller.plist family that answers each command code.
const char* FamilyOf(uint32_t command) {
  switch (command) {
    case 13: return "stats";
    case 221: return "msp";
    case 15: return "defects";
    case 17: return "telemetry";
    case 39: return "taskScheduler";
    case 22: return "snapshot";
    case 145: return "snapshotHeader";
    case 11: return "bandStats";
    default: return nullptr;
  }
}

uint32_t ReadU32(const void* base, size_t offset) {
  uint32_t v;
  std::memcpy(&v, static_cast<const uint8_t*>(base) + offset, sizeof v);
  return v;
}

bool ListHolds(const cf::Value& list, uint32_t command) {
  if (const cf::Array* a = list.AsArray())
    for (const cf::Value& v : *a)
      if (const cf::Number* n = v.AsNumber(); n && !n->IsFloat() && n->AsSInt64() == static_cast<int64_t>(command))
        return true;
  return false;
}

class NvmeClient : public UserClient {
 public:
  NvmeClient(const Service& service, DeviceFiles& files)
      : files_(files),
        // The third kind tunnels through method 8 and also answers the
        // content-deletion query; the NVMe kinds tunnel through 9.
        storage_kind_(service.class_name == "VSPStorage"),
        tunnel_method_(storage_kind_ ? 8 : 9) {}

  kern_return_t CallMethod(MethodCall& call) override {
    if (call.selector == tunnel_method_) return Tunnel(call);
    if (storage_kind_ && call.selector == 5) return ContentDeletion(call);
    return kIOReturnUnsupported;
  }

 private:
  kern_return_t Tunnel(MethodCall& call) {
    if (call.struct_in_size != 24 || !call.struct_in || !call.struct_out_size) return kIOReturnBadArgument;
    const uint32_t command = ReadU32(call.struct_in, 0);
    const uint32_t flags = ReadU32(call.struct_in, 4);
    const uint32_t index = ReadU32(call.struct_in, 8);
    const bool size_phase = flags & 1;
    const uint32_t mode = (flags >> 2) & 0xFF;
    const cf::Value controller = files_.Read("controller.plist");
    const cf::Dictionary* c = controller.AsDictionary();
    const cf::Dictionary empty;
    if (!c) c = &empty;
    if (ListHolds(c->Get(size_phase ? "failCommands" : "failDataCommands"), command)) return kIOReturnError;
    std::string bytes;
    if (const kern_return_t rc = Answer(*c, command, index, mode, &bytes); rc != kIOReturnSuccess) return rc;
    if (size_phase) {
      if (*call.struct_out_size < 4 || !call.struct_out) return kIOReturnBadArgument;
      const uint32_t size = static_cast<uint32_t>(bytes.size());
      std::memcpy(call.struct_out, &size, 4);
      *call.struct_out_size = 4;
      return kIOReturnSuccess;
    }
    size_t n = std::min(*call.struct_out_size, bytes.size());
    if (const cf::Dictionary* short_data = c->Get("shortData").AsDictionary())
      if (const cf::Number* cap = short_data->Get(std::to_string(command)).AsNumber())
        n = std::min<size_t>(n, static_cast<size_t>(std::max<int64_t>(0, cap->AsSInt64())));
    if (n > 0 && !call.struct_out) return kIOReturnBadArgument;
    if (n > 0) std::memcpy(call.struct_out, bytes.data(), n);
    *call.struct_out_size = n;
    return kIOReturnSuccess;
  }

  // The bytes of one answer: raw data as given, or a buffer encoded from a
  // field dictionary.
  kern_return_t Answer(const cf::Dictionary& c, uint32_t command, uint32_t index, uint32_t mode, std::string* out) {
    const char* family = FamilyOf(command);
    if (!family) return kIOReturnUnsupported;
    cf::Value answer = c.Get(family);
    if (command == 221) {
      const cf::Array* per_index = answer.AsArray();
      if (!per_index || index >= per_index->size()) return kIOReturnNotFound;
      answer = (*per_index)[index];
    } else if (command == 17 && answer.AsDictionary()) {
      answer = answer.AsDictionary()->Get(std::to_string(mode));
    }
    if (answer.IsNull()) return kIOReturnUnsupported;
    if (const cf::Data* d = answer.AsData()) {
      out->assign(reinterpret_cast<const char*>(d->data()), d->size());
      return kIOReturnSuccess;
    }
    std::string error;
    std::optional<std::string> encoded;
    if (const cf::Dictionary* fields = answer.AsDictionary()) {
      if (command == 13) encoded = EncodeFtlFields(*fields, &error);
      else if (command == 221) encoded = EncodeMspFields(*fields, &error);
      else if (command == 11) encoded = EncodeValidityList(*fields, &error);
      else if (command == 15) encoded = EncodeDefectsList(*fields, &error);
      else if (command == 17) encoded = EncodeTelemetryList(*fields, &error);
      else error = "only raw data is understood here";
    } else {
      error = "expected data or a dictionary of fields, not " + cf::TypeNameWithArticle(answer.type());
    }
    if (!encoded) {
      files_.Complain(std::string("controller.plist \"") + family + "\": " + error);
      return kIOReturnError;
    }
    *out = std::move(*encoded);
    return kIOReturnSuccess;
  }

  kern_return_t ContentDeletion(MethodCall& call) {
    if (call.struct_in_size != 0 || !call.struct_out_size) return kIOReturnBadArgument;
    const cf::Value controller = files_.Read("controller.plist");
    const cf::Value answer = controller.AsDictionary() ? controller.AsDictionary()->Get("contentDeletion") : cf::Value();
    std::string bytes;
    if (const cf::Data* d = answer.AsData()) {
      bytes.assign(reinterpret_cast<const char*>(d->data()), d->size());
    } else if (const cf::Number* n = answer.AsNumber()) {
      const uint32_t v = n->AsUInt32();
      bytes.assign(reinterpret_cast<const char*>(&v), 4);
    } else {
      return kIOReturnUnsupported;
    }
    const size_t n = std::min(*call.struct_out_size, bytes.size());
    if (n > 0 && !call.struct_out) return kIOReturnBadArgument;
    if (n > 0) std::memcpy(call.struct_out, bytes.data(), n);
    *call.struct_out_size = n;
    return kIOReturnSuccess;
  }

  DeviceFiles& files_;
  const bool storage_kind_;
  const uint32_t tunnel_method_;
};

}  // namespace

std::unique_ptr<UserClient> CreateNvmeClient(const Service& service, DeviceFiles& files) {
  return std::make_unique<NvmeClient>(service, files);
}

}  // namespace sim
