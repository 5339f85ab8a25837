#include "host/cgi_output.h"

#include <strings.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace kova_host {
namespace {

constexpr size_t kMaxHeaderLines = 100;

std::string_view Trim(std::string_view text) {
  const size_t first = text.find_first_not_of(" \t");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t") - first + 1);
}

bool IsToken(std::string_view name) {
  if (name.empty()) return false;
  for (char c : name) {
    const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                    c == '-' || c == '_';
    if (!ok) return false;
  }
  return true;
}

bool Is(std::string_view name, const char* wanted) {
  return name.size() == strlen(wanted) && strncasecmp(name.data(), wanted, name.size()) == 0;
}

// Parses the headers at the start of `output`; `body_start` is where the body
// begins.
bool ParseHead(std::string_view output, CgiReply& reply, size_t& body_start, std::string& error) {
  reply = CgiReply();
  size_t lines = 0;
  for (size_t start = 0;;) {
    const size_t end = output.find('\n', start);
    if (end == std::string_view::npos) {
      error = "the output has no empty line after its headers";
      return false;
    }
    std::string_view line = output.substr(start, end - start);
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    start = end + 1;
    if (line.empty()) {
      body_start = start;
      return true;
    }
    const size_t colon = line.find(':');
    const std::string_view name = line.substr(0, colon);
    if (colon == std::string_view::npos || !IsToken(name) || ++lines > kMaxHeaderLines) {
      error = "the output's headers are malformed";
      return false;
    }
    const std::string_view value = Trim(line.substr(colon + 1));
    if (Is(name, "Status")) {
      const std::string code(value.substr(0, value.find(' ')));
      const bool digits = code.size() == 3 && code.find_first_not_of("0123456789") == code.npos;
      reply.status = digits ? std::stoi(code) : 0;
      if (reply.status < 100 || reply.status > 599) {
        error = "the output's status is malformed";
        return false;
      }
    } else if (Is(name, "Content-Type")) {
      reply.content_type = value;
    } else if (!Is(name, "Content-Length") && !Is(name, "Transfer-Encoding") &&
               !Is(name, "Connection")) {
      reply.headers.emplace_back(name, value);
    }
  }
}

}  // namespace

bool ParseCgiOutput(std::string_view output, CgiReply& reply, std::string& error) {
  size_t body_start = 0;
  if (!ParseHead(output, reply, body_start, error)) return false;
  reply.body = std::string(output.substr(body_start));
  return true;
}

bool ReadCgiHead(int fd, uint64_t size, CgiReply& reply, uint64_t& body_start, std::string& error) {
  std::string head(static_cast<size_t>(std::min<uint64_t>(size, kMaxCgiHead)), '\0');
  size_t done = 0;
  while (done < head.size()) {
    const ssize_t got = pread(fd, head.data() + done, head.size() - done, off_t(done));
    if (got <= 0) {
      error = got == 0 ? "the output's file is shorter than said"
                       : std::string("cannot read the output: ") + strerror(errno);
      return false;
    }
    done += static_cast<size_t>(got);
  }
  size_t start = 0;
  if (!ParseHead(head, reply, start, error)) {
    if (head.size() == kMaxCgiHead && error.find("no empty line") != std::string::npos) {
      error = "the output's headers run past " + std::to_string(kMaxCgiHead >> 10) + " KiB";
    }
    return false;
  }
  body_start = start;
  return true;
}

}  // namespace kova_host
