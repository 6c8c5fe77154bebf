// The image driver's user client, answering from ean.plist.
//
// Selector 3 answers an image's size and selector 7 how often it was
// updated. Both take one scalar, the image's four-character code packed
// most significant byte first, and give one scalar back.
//
// ean.plist: the code's text ("dBIC", "LPEM", ...) -> {"size": N,
// "updates": N}. An image without the asked figure answers success and
// leaves the output as the caller set it; an image the file does not name
// fails. A figure must be a whole number from 0 to 2^64 - 1.
#include <optional>
#include <string>

#include "sim/device.h"
#include "sim/user_clients.h"

namespace sim {

namespace {

constexpr uint32_t kImageSize = 3;
constexpr uint32_t kUpdateCount = 7;

// The code's text, or nothing for a key wider than four bytes.
std::optional<std::string> CodeText(uint64_t key) {
  if (key > 0xFFFFFFFFu) return std::nullopt;
  std::string text(4, '\0');
  for (int i = 0; i < 4; ++i) text[i] = static_cast<char>((key >> (24 - 8 * i)) & 0xFF);
  return text;
}

// Printable in a complaint: the code as it is when it is plain text, its
// number otherwise.
std::string Printable(const std::string& code, uint64_t key) {
  for (char c : code)
    if (c < 0x20 || c > 0x7E) return std::to_string(key);
  return "\"" + code + "\"";
}

class EanClient : public UserClient {
 public:
  explicit EanClient(DeviceFiles& files) : files_(files) {}

  kern_return_t CallMethod(MethodCall& call) override {
    const char* figure = call.selector == kImageSize ? "size" : call.selector == kUpdateCount ? "updates" : nullptr;
    if (!figure) return kIOReturnUnsupported;
    if (call.scalar_in_count != 1 || !call.scalar_in || !call.scalar_out || !call.scalar_out_count ||
        *call.scalar_out_count != 1 || call.struct_in_size != 0 || (call.struct_out_size && *call.struct_out_size != 0))
      return kIOReturnBadArgument;
    const uint64_t key = call.scalar_in[0];
    const std::optional<std::string> code = CodeText(key);
    if (!code) return kIOReturnNotFound;

    const cf::Value file = files_.Read("ean.plist");
    if (file.IsNull()) return kIOReturnNotFound;  // no file: no images
    const cf::Dictionary* images = file.AsDictionary();
    if (!images) {
      files_.Complain("ean.plist: expected a dictionary of images, not " + cf::TypeNameWithArticle(file.type()));
      return kIOReturnError;
    }
    const cf::Value& image = images->Get(*code);
    if (image.IsNull()) return kIOReturnNotFound;
    const std::string where = "ean.plist " + Printable(*code, key);
    const cf::Dictionary* entry = image.AsDictionary();
    if (!entry) {
      files_.Complain(where + ": expected a dictionary, not " + cf::TypeNameWithArticle(image.type()));
      return kIOReturnError;
    }
    const cf::Value& value = entry->Get(figure);
    if (value.IsNull()) return kIOReturnSuccess;  // the output stays as it was
    const cf::Number* n = value.AsNumber();
    if (!n || n->IsFloat() || (!n->IsUnsigned() && n->AsSInt64() < 0)) {
      files_.Complain(where + " \"" + figure + "\": expected a whole number from 0 to 2^64 - 1, not " +
                      (!n             ? cf::TypeNameWithArticle(value.type())
                       : n->IsFloat() ? "a real number"
                                      : "a negative number"));
      return kIOReturnError;
    }
    call.scalar_out[0] = n->AsUInt64();
    *call.scalar_out_count = 1;
    return kIOReturnSuccess;
  }

 private:
  DeviceFiles& files_;
};

}  // namespace

std::unique_ptr<UserClient> CreateEanClient(const Service&, DeviceFiles& files) {
  return std::make_unique<EanClient>(files);
}

}  // namespace sim
