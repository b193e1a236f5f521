#include "json_writer.h"

#include <stdio.h>

namespace s2s_tools {

namespace {

// Length of the valid UTF-8 sequence at `s[i]` (1 to 4), or 0 when the byte
// there does not start one: overlong forms, surrogates and code points above
// U+10FFFF are not valid.
size_t Utf8Length(const std::string& s, size_t i) {
  const unsigned char c = static_cast<unsigned char>(s[i]);
  size_t n;
  unsigned int min;
  unsigned int cp;
  if (c < 0x80) return 1;
  if ((c & 0xE0) == 0xC0) {
    n = 2, min = 0x80, cp = c & 0x1F;
  } else if ((c & 0xF0) == 0xE0) {
    n = 3, min = 0x800, cp = c & 0x0F;
  } else if ((c & 0xF8) == 0xF0) {
    n = 4, min = 0x10000, cp = c & 0x07;
  } else {
    return 0;
  }
  if (i + n > s.size()) return 0;
  for (size_t k = 1; k < n; ++k) {
    const unsigned char t = static_cast<unsigned char>(s[i + k]);
    if ((t & 0xC0) != 0x80) return 0;
    cp = (cp << 6) | (t & 0x3F);
  }
  if (cp < min || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return 0;
  return n;
}

void AppendEscaped(unsigned char c, std::string& out) {
  char buf[8];
  snprintf(buf, sizeof buf, "\\u%04x", c);
  out += buf;
}

void AppendString(const std::string& s, std::string& out) {
  out += '"';
  for (size_t i = 0; i < s.size();) {
    const unsigned char c = static_cast<unsigned char>(s[i]);
    const size_t n = Utf8Length(s, i);
    if (n == 0) {
      AppendEscaped(c, out);
      ++i;
      continue;
    }
    if (n > 1) {
      out.append(s, i, n);
    } else if (c == '"') {
      out += "\\\"";
    } else if (c == '\\') {
      out += "\\\\";
    } else if (c == '\n') {
      out += "\\n";
    } else if (c == '\t') {
      out += "\\t";
    } else if (c == '\r') {
      out += "\\r";
    } else if (c < 0x20 || c == 0x7F) {
      AppendEscaped(c, out);
    } else {
      out += static_cast<char>(c);
    }
    i += n;
  }
  out += '"';
}

void Indent(bool pretty, int depth, std::string& out) {
  if (!pretty) return;
  out += '\n';
  out.append(static_cast<size_t>(depth) * 2, ' ');
}

void Append(const S2S::PObject& v, bool pretty, int depth, std::string& out) {
  if (v.isInteger()) {
    const unsigned long long u = v.asUInt64();
    out += (u >> 63) != 0 ? std::to_string(static_cast<long long>(u))
                          : std::to_string(u);
  } else if (v.isString()) {
    AppendString(v.asString(), out);
  } else if (v.isMap()) {
    const auto& m = v.asMap();
    if (m.empty()) {
      out += "{}";
      return;
    }
    out += '{';
    bool first = true;
    for (const auto& member : m) {
      if (!first) out += ',';
      first = false;
      Indent(pretty, depth + 1, out);
      AppendString(member.first, out);
      out += pretty ? ": " : ":";
      Append(member.second, pretty, depth + 1, out);
    }
    Indent(pretty, depth, out);
    out += '}';
  } else if (v.isArray()) {
    const auto& a = v.asArray();
    if (a.empty()) {
      out += "[]";
      return;
    }
    out += '[';
    for (size_t i = 0; i < a.size(); ++i) {
      if (i > 0) out += ',';
      Indent(pretty, depth + 1, out);
      Append(a[i], pretty, depth + 1, out);
    }
    Indent(pretty, depth, out);
    out += ']';
  } else {
    out += "null";
  }
}

}  // namespace

std::string ToJson(const S2S::PObject& value, bool pretty) {
  std::string out;
  Append(value, pretty, 0, out);
  return out;
}

std::string JsonString(const std::string& text) {
  std::string out;
  AppendString(text, out);
  return out;
}

}  // namespace s2s_tools
