#include "common/SXFormat.h"

#include <cstdio>
#include <cstring>

#include "common/SXValueText.h"

std::string SXFormatArg::text() const {
  struct Visitor {
    std::string operator()(std::monostate) const { return "(null)"; }
    std::string operator()(int64_t v) const { return std::to_string(v); }
    std::string operator()(uint64_t v) const { return std::to_string(v); }
    std::string operator()(double v) const { return SXDoubleText(v); }
    std::string operator()(const Text& t) const {
      return t.present ? std::string(t.view) : std::string("(null)");
    }
    std::string operator()(const SXValue* v) const { return SXValueText(*v); }
  };
  return std::visit(Visitor{}, v_);
}

void SXFormatArg::appendText(std::string& out) const {
  if (const auto* t = std::get_if<Text>(&v_); t && t->present) {
    out.append(t->view);
  } else {
    out.append(text());
  }
}

int64_t SXFormatArg::asSigned() const {
  if (auto* i = std::get_if<int64_t>(&v_)) return *i;
  if (auto* u = std::get_if<uint64_t>(&v_)) return static_cast<int64_t>(*u);
  if (auto* d = std::get_if<double>(&v_)) return static_cast<int64_t>(*d);
  if (auto* v = std::get_if<const SXValue*>(&v_); v && (*v)->is_number()) {
    return (*v)->is_number_unsigned() ? static_cast<int64_t>((*v)->get<uint64_t>())
                                      : (*v)->get<int64_t>();
  }
  return 0;
}

uint64_t SXFormatArg::asUnsigned() const { return static_cast<uint64_t>(asSigned()); }

double SXFormatArg::asDouble() const {
  if (auto* d = std::get_if<double>(&v_)) return *d;
  if (auto* u = std::get_if<uint64_t>(&v_)) return static_cast<double>(*u);
  if (auto* v = std::get_if<const SXValue*>(&v_); v && (*v)->is_number()) {
    return (*v)->get<double>();
  }
  return static_cast<double>(asSigned());
}

namespace {

// Formats one numeric conversion with the C library, after replacing the caller's length
// modifiers by the one that matches the width we pass.
template <typename T>
void appendNumber(std::string& out, std::string_view flags, const char* length, char conv,
                  T value) {
  std::string conversion = "%";
  conversion.append(flags);
  conversion.append(length);
  conversion.push_back(conv);
  char buf[128];
  int n = std::snprintf(buf, sizeof buf, conversion.c_str(), value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof buf) {
    out.append(buf, static_cast<size_t>(n));
  } else {
    std::string big(static_cast<size_t>(n) + 1, '\0');
    std::snprintf(big.data(), big.size(), conversion.c_str(), value);
    out.append(big.data(), static_cast<size_t>(n));
  }
}

}  // namespace

std::string SXFormatV(std::string_view format, std::initializer_list<SXFormatArg> args) {
  std::string out;
  SXFormatAppendV(out, format, args);
  return out;
}

void SXFormatAppendV(std::string& out, std::string_view format,
                     std::initializer_list<SXFormatArg> args) {
  static const SXFormatArg kMissing(nullptr);
  out.reserve(out.size() + format.size() + 32);
  auto next = args.begin();
  auto take = [&]() -> const SXFormatArg& { return next != args.end() ? *next++ : kMissing; };

  for (size_t i = 0; i < format.size(); ++i) {
    char c = format[i];
    if (c != '%' || i + 1 >= format.size()) {
      out.push_back(c);
      continue;
    }
    size_t j = i + 1;
    if (format[j] == '%') {
      out.push_back('%');
      i = j;
      continue;
    }
    size_t flagsStart = j;
    while (j < format.size() && std::strchr("-+ #0123456789.", format[j])) ++j;
    std::string_view flags = format.substr(flagsStart, j - flagsStart);
    while (j < format.size() && std::strchr("hlqLzjt", format[j])) ++j;
    if (j >= format.size()) {
      out.append(format.substr(i));
      break;
    }
    char conv = format[j];
    const SXFormatArg& arg = take();
    if (arg.isNull() && conv != '%') {
      out.append("(null)");
      i = j;
      continue;
    }
    switch (conv) {
      case '@':
      case 's':
        arg.appendText(out);
        break;
      case 'd':
      case 'i':
        appendNumber(out, flags, "ll", conv, static_cast<long long>(arg.asSigned()));
        break;
      case 'u':
      case 'x':
      case 'X':
      case 'o':
        appendNumber(out, flags, "ll", conv, static_cast<unsigned long long>(arg.asUnsigned()));
        break;
      case 'f':
      case 'F':
      case 'e':
      case 'E':
      case 'g':
      case 'G':
        appendNumber(out, flags, "", conv, arg.asDouble());
        break;
      case 'c':
        out.push_back(static_cast<char>(arg.asSigned()));
        break;
      default:
        out.append(format.substr(i, j - i + 1));
        break;
    }
    i = j;
  }
}
