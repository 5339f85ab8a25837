// JSON text written straight into a string, for answers too large to build as
// a tree of values first: numbers in their shortest exact form (12.3, not
// 12.300000000000001), texts quoted and escaped, commas placed.

#ifndef KOVA_DAEMONS_STATD_JSON_OUT_H_
#define KOVA_DAEMONS_STATD_JSON_OUT_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

namespace statd {

class JsonOut {
 public:
  // Appends to `out`, which must outlive the writer.
  explicit JsonOut(std::string& out) : out_(out) {}

  JsonOut& BeginObject() { return Open('{'); }
  JsonOut& EndObject() { return Close('}'); }
  JsonOut& BeginArray() { return Open('['); }
  JsonOut& EndArray() { return Close(']'); }
  // The key of the next member of the object being written.
  JsonOut& Key(std::string_view key);

  JsonOut& Text(std::string_view text);
  JsonOut& Number(int64_t number);
  // A number that isn't finite, which JSON can't hold, is written as null.
  JsonOut& Number(double number);

  template <typename T>
  JsonOut& Array(const std::vector<T>& items) {
    BeginArray();
    for (const T& item : items) {
      if constexpr (std::is_same_v<T, std::string>) {
        Text(item);
      } else {
        Number(item);
      }
    }
    return EndArray();
  }

 private:
  JsonOut& Open(char bracket);
  JsonOut& Close(char bracket);
  // A comma before every value but the first of its array, and none after a key.
  void Separate();

  std::string& out_;
  std::vector<bool> first_;  // per open object or array: nothing written in it yet
  bool after_key_ = false;
};

}  // namespace statd

#endif  // KOVA_DAEMONS_STATD_JSON_OUT_H_
