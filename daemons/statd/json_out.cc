#include "statd/json_out.h"

#include <charconv>
#include <cmath>
#include <cstdio>

namespace statd {

JsonOut& JsonOut::Key(std::string_view key) {
  Text(key);
  out_ += ':';
  after_key_ = true;
  return *this;
}

JsonOut& JsonOut::Text(std::string_view text) {
  Separate();
  out_ += '"';
  for (const char c : text) {
    switch (c) {
      case '"':
        out_ += "\\\"";
        break;
      case '\\':
        out_ += "\\\\";
        break;
      case '\n':
        out_ += "\\n";
        break;
      case '\t':
        out_ += "\\t";
        break;
      case '\r':
        out_ += "\\r";
        break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          char escape[8];
          snprintf(escape, sizeof(escape), "\\u%04x", c);
          out_ += escape;
        } else {
          out_ += c;  // UTF-8 goes as it is
        }
    }
  }
  out_ += '"';
  return *this;
}

JsonOut& JsonOut::Number(int64_t number) {
  Separate();
  char text[24];
  out_.append(text, std::to_chars(text, text + sizeof(text), number).ptr);
  return *this;
}

JsonOut& JsonOut::Number(double number) {
  Separate();
  if (!std::isfinite(number)) {
    out_ += "null";
    return *this;
  }
  char text[32];
  out_.append(text, std::to_chars(text, text + sizeof(text), number).ptr);
  return *this;
}

JsonOut& JsonOut::Open(char bracket) {
  Separate();
  out_ += bracket;
  first_.push_back(true);
  return *this;
}

JsonOut& JsonOut::Close(char bracket) {
  out_ += bracket;
  first_.pop_back();
  return *this;
}

void JsonOut::Separate() {
  if (after_key_) {
    after_key_ = false;
  } else if (!first_.empty() && !first_.back()) {
    out_ += ',';
  }
  if (!first_.empty()) first_.back() = false;
}

}  // namespace statd
