// The test platform's configuration files, services, shares, statistics
// service, texts, records and control.

#include <json/writer.h>

#include <cstdio>
#include <cstring>

#include "common/temp_file.h"
#include "fake/fake_state.h"
#include "kova/conf.h"
#include "kova/error.h"
#include "kova/service.h"
#include "kova/text.h"
#include "kova/transmitor.h"

namespace kova_fake {

State& TheState() {
  static State state;
  return state;
}

void Record(const std::string& call) { TheState().calls.push_back(call); }

void Reset() {
  TheState() = State();
  SyncLogFile();
}

void SetConf(const std::string& file, const std::string& key, const std::string& value) {
  TheState().conf[file][key] = value;
}

std::optional<std::string> GetConf(const std::string& file, const std::string& key) {
  const auto& conf = TheState().conf;
  auto f = conf.find(file);
  if (f == conf.end() || f->second.count(key) == 0) return std::nullopt;
  return f->second.at(key);
}

void FailConfRead(const std::string& file, int result, const std::string& key) {
  TheState().conf_read_failures[{file, key}] = result;
}

void FailConfWrite(const std::string& key, int result) {
  TheState().conf_write_failures[key] = result;
}

void SetServiceRunning(const std::string& name, bool running) {
  TheState().services[name].running = running;
}

void SetServiceDisplayName(const std::string& name, const std::string& display) {
  TheState().services[name].display = display;
}

void FailService(const std::string& name, const std::string& operation, int result) {
  TheState().services[name].failures[operation] = result;
}

void SetVolumeLookup(const std::string& link, int result, const std::string& volume) {
  TheState().volumes[link] = {result, volume};
}

void QueueExchange(const Exchange& exchange) { TheState().exchanges.push_back(exchange); }

void SetText(const std::string& section, const std::string& key, const std::string& text) {
  TheState().texts[section][key] = text;
}

const std::vector<std::string>& TempFiles() { return TheState().temp_files; }

const std::vector<std::string>& Calls() { return TheState().calls; }

const std::vector<SyslogLine>& Syslog() { return TheState().syslog; }

namespace {

// The arranged failure of reading `key` in `file`, 0 when none.
int ConfReadFailure(const std::string& file, const std::string& key) {
  const auto& failures = TheState().conf_read_failures;
  for (const auto& which : {std::make_pair(file, key), std::make_pair(file, std::string())}) {
    auto it = failures.find(which);
    if (it != failures.end()) {
      KOVA_SET_ERROR(KOVA_ERR_IO);
      return it->second;
    }
  }
  return 0;
}

// The configured failure of `operation` on service `name`, 0 when none.
int ServiceFailure(const std::string& name, const std::string& operation) {
  auto& failures = TheState().services[name].failures;
  auto it = failures.find(operation);
  if (it == failures.end()) return 0;
  KOVA_SET_ERROR(KOVA_ERR_SERVICE_FAILED);
  return it->second;
}

std::string Compact(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

}  // namespace

}  // namespace kova_fake

using kova_fake::Record;
using kova_fake::TheState;

int QLIBCFileGetKeyValue(const char* file, const char* key, char* value, size_t size, int) {
  Record(std::string("QLIBCFileGetKeyValue ") + file + " " + key);
  if (int failure = kova_fake::ConfReadFailure(file, key)) return failure;
  std::optional<std::string> stored = kova_fake::GetConf(file, key);
  if (!stored) return 0;
  snprintf(value, size, "%s", stored->c_str());
  return 1;
}

int QLIBCINFOSetKeyValue(const char* key, const char* value) {
  Record(std::string("QLIBCINFOSetKeyValue ") + key + "=" + value);
  auto failure = TheState().conf_write_failures.find(key);
  if (failure != TheState().conf_write_failures.end()) return failure->second;
  TheState().conf[kKovaInfoConf][key] = value;
  return 0;
}

int QLIBCFileCheckKeyValue(const char* file, const char* key, const char* value, int) {
  Record(std::string("QLIBCFileCheckKeyValue ") + file + " " + key);
  if (int failure = kova_fake::ConfReadFailure(file, key)) return failure;
  return kova_fake::GetConf(file, key) == std::string(value) ? 1 : 0;
}

int QLIBCFileITmpName(const char* prefix, char* name, size_t size) {
  const int result = kova::MakeTempFile(prefix, name, size);
  if (result == 0) TheState().temp_files.push_back(name);
  return result;
}

int QLIBServiceIsRunning(const char* name) {
  Record(std::string("QLIBServiceIsRunning ") + name);
  return TheState().services[name].running ? 1 : 0;
}

int QLIBServiceStart(const char* name, int) {
  Record(std::string("QLIBServiceStart ") + name);
  if (int failure = kova_fake::ServiceFailure(name, "start")) return failure;
  TheState().services[name].running = true;
  return 0;
}

int QLIBServiceStop(const char* name, int) {
  Record(std::string("QLIBServiceStop ") + name);
  if (int failure = kova_fake::ServiceFailure(name, "stop")) return failure;
  TheState().services[name].running = false;
  return 0;
}

int QLIBServiceReload(const char* name) {
  Record(std::string("QLIBServiceReload ") + name);
  return kova_fake::ServiceFailure(name, "reload");
}

int QLIBServicecfgDisplayNameGet(const char* name, char* display, size_t size) {
  const auto& service = TheState().services[name];
  if (!service.display) return -1;
  snprintf(display, size, "%s", service.display->c_str());
  return 0;
}

int KOVAShareServiceVolumeGetbyLink(const char* link, char* volume, size_t size) {
  Record(std::string("KOVAShareServiceVolumeGetbyLink ") + link);
  auto it = TheState().volumes.find(link);
  if (it == TheState().volumes.end()) return 0;
  snprintf(volume, size, "%s", it->second.second.c_str());
  return it->second.first;
}

struct StringBundle::Impl {
  std::vector<std::string> sections;
};

StringBundle::StringBundle(const char* section1, const char* section2, const char* section3,
                           const char* section4, const char* section5, const char* section6)
    : impl_(new Impl) {
  for (const char* section : {section1, section2, section3, section4, section5, section6}) {
    if (section != nullptr) impl_->sections.push_back(section);
  }
}

StringBundle::~StringBundle() { delete impl_; }

const char* StringBundle::Text(const char* key, const char* missing) const {
  for (const std::string& section : impl_->sections) {
    const auto& texts = TheState().texts[section];
    auto it = texts.find(key);
    if (it != texts.end()) return it->second.c_str();
  }
  return missing;
}

struct Transmitor::Impl {
  std::string host;
  std::optional<kova_fake::Exchange> exchange;
};

Transmitor::Transmitor(const char* host) : impl_(new Impl{host, std::nullopt}) {}

Transmitor::~Transmitor() { delete impl_; }

int Transmitor::Transmit(const Json::Value& request) {
  Record("Transmit " + impl_->host + " " + kova_fake::Compact(request));
  auto& exchanges = TheState().exchanges;
  if (exchanges.empty()) {
    KOVA_SET_ERROR(KOVA_ERR_CONNECT);
    return -1;
  }
  impl_->exchange = exchanges.front();
  exchanges.pop_front();
  return impl_->exchange->transmit_result;
}

int Transmitor::GetDataJson(Json::Value& reply) {
  if (!impl_->exchange) return -1;
  if (impl_->exchange->get_result < 0) return impl_->exchange->get_result;
  reply = impl_->exchange->reply;
  return impl_->exchange->get_result;
}
