// Localised string tables: INI files under /usr/share/kova/texts/<language>/.
//
// Every *.ini file of the language's directory is read in name order; a
// section or key read later adds to or replaces what came before. English
// ("enu") is read first whatever the language, so that a key missing from a
// translation shows in English. The language is the key "language" of
// /etc/kovainfo.conf, "enu" when absent.

#include <dirent.h>

#include <algorithm>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "kova/conf.h"
#include "kova/text.h"
#include "src/atomic_file.h"
#include "src/conf_file.h"
#include "src/system_root.h"

namespace {

constexpr char kTextsDir[] = "/usr/share/kova/texts/";
constexpr char kDefaultLanguage[] = "enu";

std::string_view Trim(std::string_view text) {
  const size_t first = text.find_first_not_of(" \t\r");
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(" \t\r") - first + 1);
}

std::vector<std::string> IniFiles(const std::string& language) {
  std::vector<std::string> files;
  const std::string dir = kova::RootPath(kTextsDir + language);
  DIR* stream = opendir(dir.c_str());
  if (stream == nullptr) return files;
  while (const dirent* entry = readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name.size() > 4 && name.substr(name.size() - 4) == ".ini" && name.front() != '.') {
      files.push_back(dir + "/" + std::string(name));
    }
  }
  closedir(stream);
  std::sort(files.begin(), files.end());
  return files;
}

}  // namespace

struct StringBundle::Impl {
  std::vector<std::string> sections;
  std::map<std::string, std::map<std::string, std::string>, std::less<>> texts;

  void Load(const std::string& file) {
    std::string content;
    if (!kova::ReadWholeFile(file, content)) return;
    std::map<std::string, std::string>* section = nullptr;
    std::string_view rest = content;
    while (!rest.empty()) {
      const size_t end = rest.find('\n');
      const std::string_view line = Trim(rest.substr(0, end));
      rest.remove_prefix(end == std::string_view::npos ? rest.size() : end + 1);
      if (line.empty() || line.front() == ';' || line.front() == '#') continue;
      if (line.front() == '[' && line.back() == ']') {
        auto it = texts.find(line.substr(1, line.size() - 2));
        section = it != texts.end() ? &it->second : nullptr;  // only the sections asked for
        continue;
      }
      const size_t equals = line.find('=');
      if (section == nullptr || equals == std::string_view::npos) continue;
      std::string_view value = Trim(line.substr(equals + 1));
      if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
        value = value.substr(1, value.size() - 2);
      }
      (*section)[std::string(Trim(line.substr(0, equals)))] = std::string(value);
    }
  }
};

StringBundle::StringBundle(const char* section1, const char* section2, const char* section3,
                           const char* section4, const char* section5, const char* section6)
    : impl_(new Impl) {
  for (const char* section : {section1, section2, section3, section4, section5, section6}) {
    if (section == nullptr) continue;
    impl_->sections.push_back(section);
    impl_->texts[section];
  }
  std::string language;
  if (kova::ConfRead(kova::RootPath(kKovaInfoConf), "language", language) <= 0 ||
      !kova::IsPlainName(language)) {
    language = kDefaultLanguage;
  }
  std::vector<std::string> files = IniFiles(kDefaultLanguage);
  if (language != kDefaultLanguage) {
    for (std::string& file : IniFiles(language)) files.push_back(std::move(file));
  }
  for (const std::string& file : files) impl_->Load(file);
}

StringBundle::~StringBundle() { delete impl_; }

const char* StringBundle::Text(const char* key, const char* missing) const {
  if (key == nullptr) return missing;
  for (const std::string& section : impl_->sections) {
    const auto& texts = impl_->texts.find(section)->second;
    auto it = texts.find(key);
    if (it != texts.end()) return it->second.c_str();
  }
  return missing;
}
