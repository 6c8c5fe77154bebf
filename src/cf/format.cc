#include "cf/format.h"

#include <cstdio>
#include <algorithm>
#include <climits>
#include <cstring>

namespace cf {

int64_t FormatArg::AsSigned() const {
  switch (kind_) {
    case Kind::kSigned: return i_;
    case Kind::kUnsigned: return static_cast<int64_t>(u_);
    case Kind::kDouble: return Number::Float64(d_).AsSInt64();
    case Kind::kPointer: return static_cast<int64_t>(reinterpret_cast<uintptr_t>(p_));
    case Kind::kValue:
      if (auto n = v_->AsNumber()) return n->AsSInt64();
      if (auto b = v_->AsBool()) return *b;
      return 0;
    default: return 0;
  }
}

uint64_t FormatArg::AsUnsigned() const {
  if (kind_ == Kind::kUnsigned) return u_;
  if (kind_ == Kind::kValue)
    if (auto n = v_->AsNumber()) return n->AsUInt64();
  if (kind_ == Kind::kDouble) return Number::Float64(d_).AsUInt64();
  return static_cast<uint64_t>(AsSigned());
}

double FormatArg::AsDouble() const {
  switch (kind_) {
    case Kind::kDouble: return d_;
    case Kind::kSigned: return static_cast<double>(i_);
    case Kind::kUnsigned: return static_cast<double>(u_);
    case Kind::kValue:
      if (auto n = v_->AsNumber()) return n->AsFloat64();
      return 0;
    default: return 0;
  }
}

std::string FormatArg::AsText() const {
  switch (kind_) {
    case Kind::kCString: return s_ ? s_ : "(null)";
    case Kind::kValue: return v_->IsNull() ? "(null)" : v_->Description();
    case Kind::kSigned: return std::to_string(i_);
    case Kind::kUnsigned: return std::to_string(u_);
    case Kind::kDouble: return Number::Float64(d_).Description();
    case Kind::kPointer: {
      char buf[32];
      std::snprintf(buf, sizeof buf, "%p", p_);
      return buf;
    }
    default: return "(null)";
  }
}

const void* FormatArg::AsPointer() const {
  if (kind_ == Kind::kPointer) return p_;
  if (kind_ == Kind::kCString) return s_;
  return reinterpret_cast<const void*>(static_cast<uintptr_t>(AsUnsigned()));
}

namespace {

void Append(std::string& out, const char* spec, auto value) {
  char buf[128];
  int n = std::snprintf(buf, sizeof buf, spec, value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof buf) {
    out.append(buf, static_cast<size_t>(n));
    return;
  }
  std::string big(static_cast<size_t>(n) + 1, '\0');
  std::snprintf(big.data(), big.size(), spec, value);
  out.append(big.data(), static_cast<size_t>(n));
}

// Pads text to a printf width ("-" flag for left alignment) and cuts it to
// a precision, as %s does.
void AppendText(std::string& out, std::string text, bool left, int width, int precision) {
  if (precision >= 0 && static_cast<size_t>(precision) < text.size()) text.resize(static_cast<size_t>(precision));
  const size_t w = width > 0 ? static_cast<size_t>(width) : 0;
  if (text.size() >= w) {
    out += text;
  } else if (left) {
    out += text;
    out.append(w - text.size(), ' ');
  } else {
    out.append(w - text.size(), ' ');
    out += text;
  }
}

}  // namespace

std::string FormatV(std::string_view fmt, const FormatArg* args, size_t count) {
  std::string out;
  out.reserve(fmt.size() + 16);
  size_t next = 0;
  const FormatArg kMissing;
  auto take = [&]() -> const FormatArg& { return next < count ? args[next++] : kMissing; };

  for (size_t i = 0; i < fmt.size();) {
    const char c = fmt[i];
    if (c != '%') {
      const size_t pct = fmt.find('%', i);
      const size_t end = pct == std::string_view::npos ? fmt.size() : pct;
      out.append(fmt.substr(i, end - i));
      i = end;
      continue;
    }
    const size_t start = i++;
    if (i < fmt.size() && fmt[i] == '%') {
      out += '%';
      ++i;
      continue;
    }
    // Privacy annotations such as {public} do not change the text.
    if (i < fmt.size() && fmt[i] == '{') {
      const size_t close = fmt.find('}', i);
      if (close == std::string_view::npos) {
        out.append(fmt.substr(start));
        break;
      }
      i = close + 1;
    }
    std::string flags;
    while (i < fmt.size() && fmt[i] != '\0' && std::strchr("-+ #0'", fmt[i])) flags += fmt[i++];
    int width = -1, precision = -1;
    // Widths and precisions are bounded, whether written in the format or
    // taken from an argument, so no input can make one text huge.
    constexpr int64_t kMaxWidth = 4096;
    if (i < fmt.size() && fmt[i] == '*') {
      const int64_t w = take().AsSigned();
      if (w < 0) flags += '-';
      width = static_cast<int>(std::min<int64_t>(w < 0 ? (w == INT64_MIN ? kMaxWidth : -w) : w, kMaxWidth));
      ++i;
    } else {
      while (i < fmt.size() && fmt[i] >= '0' && fmt[i] <= '9')
        width = static_cast<int>(std::min<int64_t>((width < 0 ? 0 : width) * 10 + (fmt[i++] - '0'), kMaxWidth));
    }
    if (i < fmt.size() && fmt[i] == '.') {
      ++i;
      precision = 0;
      if (i < fmt.size() && fmt[i] == '*') {
        const int64_t p = take().AsSigned();
        precision = p < 0 ? -1 : static_cast<int>(std::min<int64_t>(p, kMaxWidth));  // negative: as if absent
        ++i;
      } else {
        while (i < fmt.size() && fmt[i] >= '0' && fmt[i] <= '9')
          precision = static_cast<int>(std::min<int64_t>(int64_t{precision} * 10 + (fmt[i++] - '0'), kMaxWidth));
      }
    }
    std::string length;
    while (i < fmt.size() && fmt[i] != '\0' && std::strchr("hlqjztL", fmt[i])) length += fmt[i++];
    if (i >= fmt.size()) {
      out.append(fmt.substr(start));
      break;
    }
    const char conv = fmt[i++];
    std::string spec = "%" + flags;
    if (width >= 0) spec += std::to_string(width);
    if (precision >= 0) spec += "." + std::to_string(precision);
    const bool wide = length == "l" || length == "ll" || length == "q" || length == "j" ||
                      length == "z" || length == "t";
    switch (conv) {
      case 'd':
      case 'i': {
        int64_t v = take().AsSigned();
        if (!wide) v = length == "hh" ? int8_t(v) : length == "h" ? int16_t(v) : int32_t(v);
        Append(out, (spec + "lld").c_str(), static_cast<long long>(v));
        break;
      }
      case 'u':
      case 'x':
      case 'X':
      case 'o': {
        uint64_t v = take().AsUnsigned();
        if (!wide) v = length == "hh" ? uint8_t(v) : length == "h" ? uint16_t(v) : uint32_t(v);
        Append(out, (spec + "ll" + conv).c_str(), static_cast<unsigned long long>(v));
        break;
      }
      case 'c':
        Append(out, (spec + "c").c_str(), static_cast<int>(static_cast<unsigned char>(take().AsSigned())));
        break;
      case 'f': case 'F': case 'e': case 'E': case 'g': case 'G': case 'a': case 'A':
        Append(out, (spec + conv).c_str(), take().AsDouble());
        break;
      case 'p':
        Append(out, (spec + "p").c_str(), take().AsPointer());
        break;
      case 's':
      case '@':
        AppendText(out, take().AsText(), flags.find('-') != std::string::npos, width, precision);
        break;
      default:
        // Unknown conversion: keep the text so the mistake is visible.
        out.append(fmt.substr(start, i - start));
        break;
    }
  }
  return out;
}

}  // namespace cf
