#include "sim/kcdata.h"

#include "parsers/kcdata.h"

namespace sim {
namespace {

template <typename T>
void Put(std::string& out, T v) {
  for (size_t i = 0; i < sizeof(T); ++i) out += static_cast<char>((static_cast<uint64_t>(v) >> (8 * i)) & 0xFF);
}

std::string Padded(std::string_view name, size_t padded) {
  std::string s(name);
  if (s.size() < padded) s.resize(padded, '\0');
  return s;
}

bool Fail(std::string* error, std::string text) {
  if (error) *error = "stackshot: " + std::move(text);
  return false;
}

// A name of 1 to 63 characters without NUL: longer ones would lose their
// terminator in the padded field, and a NUL would cut the name short.
bool CheckName(const cf::Value& value, const std::string& where, std::string* error) {
  const cf::String* name = value.AsString();
  if (!name) {
    const std::string what = value.IsNull() ? "missing" : cf::TypeNameWithArticle(value.type());
    return Fail(error, where + ": \"name\" must be a string, not " + what);
  }
  if (name->empty() || name->size() >= kKCDataNameBytes || name->find('\0') != std::string::npos)
    return Fail(error, where + ": \"name\" must have 1 to 63 characters and no NUL");
  return true;
}

// A hand-written description with a misspelt key would silently lose a
// thread or its writes, so unknown keys are refused.
bool CheckKeys(const cf::Dictionary& d, std::initializer_list<const char*> known, const std::string& where,
               std::string* error) {
  for (const auto& [key, value] : d) {
    bool ok = false;
    for (const char* k : known) ok |= key == cf::Value(k);
    if (!ok) return Fail(error, where + ": unknown key \"" + key.Description() + "\"");
  }
  return true;
}

class Encoder {
 public:
  bool Task(const cf::Value& task, size_t index, std::string* error) {
    const std::string where = "task " + std::to_string(index);
    const cf::Dictionary* d = task.AsDictionary();
    if (!d) return Fail(error, where + " must be a dictionary, not " + cf::TypeNameWithArticle(task.type()));
    if (!CheckKeys(*d, {"name", "threads"}, where, error) || !CheckName(d->Get("name"), where, error)) return false;
    const cf::Value& threads = d->Get("threads");
    if (!threads.IsNull() && !threads.AsArray())
      return Fail(error, where + ": \"threads\" must be an array, not " + cf::TypeNameWithArticle(threads.type()));
    const uint64_t id = next_id_++;
    out_.Begin(id, kKCDataTaskKind).TaskName(*d->Get("name").AsString());
    if (const cf::Array* list = threads.AsArray()) {
      for (size_t i = 0; i < list->size(); ++i)
        if (!Thread((*list)[i], where + ", thread " + std::to_string(i), error)) return false;
    }
    out_.End(id);
    return true;
  }

  KCDataBuilder& out() { return out_; }

 private:
  bool Thread(const cf::Value& thread, const std::string& where, std::string* error) {
    const cf::Dictionary* d = thread.AsDictionary();
    if (!d) return Fail(error, where + " must be a dictionary, not " + cf::TypeNameWithArticle(thread.type()));
    if (!CheckKeys(*d, {"name", "diskWrites"}, where, error) || !CheckName(d->Get("name"), where, error))
      return false;
    const cf::Value& writes = d->Get("diskWrites");
    const cf::Number* n = writes.AsNumber();
    if (!writes.IsNull() && !n)
      return Fail(error, where + ": \"diskWrites\" must be a number, not " + cf::TypeNameWithArticle(writes.type()));
    // Bytes are whole and never negative; a real or a negative number is a
    // mistake in the description, not something to round or wrap.
    if (n && (n->IsFloat() || (!n->IsUnsigned() && n->AsSInt64() < 0)))
      return Fail(error, where + ": \"diskWrites\" must be a whole number of bytes, not " + n->Description());
    const uint64_t id = next_id_++;
    out_.Begin(id, kKCDataThreadKind).ThreadName(*d->Get("name").AsString());
    if (n) out_.IOStats(n->AsUInt64());
    out_.End(id);
    return true;
  }

  KCDataBuilder out_;
  uint64_t next_id_ = 2;  // 1 is the stackshot container
};

}  // namespace

KCDataBuilder& KCDataBuilder::Item(uint32_t type, std::string_view payload, uint64_t flags) {
  Header(type, static_cast<uint32_t>(payload.size()), flags);
  bytes_ += payload;
  return *this;
}

KCDataBuilder& KCDataBuilder::Header(uint32_t type, uint32_t size, uint64_t flags) {
  Put(bytes_, type);
  Put(bytes_, size);
  Put(bytes_, flags);
  return *this;
}

KCDataBuilder& KCDataBuilder::Bytes(std::string_view raw) {
  bytes_ += raw;
  return *this;
}

KCDataBuilder& KCDataBuilder::Begin(uint64_t id, uint32_t kind) {
  std::string payload;
  Put(payload, kind);
  return Item(KCDATA_TYPE_CONTAINER_BEGIN, payload, id);
}

KCDataBuilder& KCDataBuilder::End(uint64_t id) { return Item(KCDATA_TYPE_CONTAINER_END, "", id); }

KCDataBuilder& KCDataBuilder::ThreadName(std::string_view name, size_t padded) {
  return Item(STACKSHOT_KCTYPE_THREAD_NAME, Padded(name, padded));
}

KCDataBuilder& KCDataBuilder::TaskName(std::string_view name) {
  return Item(kKCDataTaskNameType, Padded(name, kKCDataNameBytes));
}

KCDataBuilder& KCDataBuilder::IOStats(uint64_t diskWrites) { return IOStatsFields({0, 0, 0, diskWrites}); }

KCDataBuilder& KCDataBuilder::IOStatsFields(const std::vector<uint64_t>& fields) {
  std::string payload;
  for (uint64_t f : fields) Put(payload, f);
  return Item(STACKSHOT_KCTYPE_IOSTATS, payload);
}

KCDataBuilder& KCDataBuilder::BufferEnd() { return Item(KCDATA_TYPE_BUFFER_END, ""); }

std::optional<std::string> EncodeKCDataStackshot(const cf::Value& tasks, std::string* error) {
  const cf::Array* list = tasks.AsArray();
  if (!list) {
    Fail(error, "the description must be an array of tasks, not " + cf::TypeNameWithArticle(tasks.type()));
    return std::nullopt;
  }
  Encoder encoder;
  encoder.out().Begin(1, kKCDataStackshotKind);
  for (size_t i = 0; i < list->size(); ++i)
    if (!encoder.Task((*list)[i], i, error)) return std::nullopt;
  encoder.out().End(1).BufferEnd();
  return encoder.out().bytes();
}

}  // namespace sim
