// Client of the statistics-collection service: one JSON request, one JSON reply.

#ifndef KOVA_TRANSMITOR_H_
#define KOVA_TRANSMITOR_H_

#include <json/value.h>

#include "kova/export.h"

class KOVA_API Transmitor {
 public:
  // A client of the service on `host`; "localhost" is this machine's service.
  explicit Transmitor(const char* host);
  ~Transmitor();
  Transmitor(const Transmitor&) = delete;
  Transmitor& operator=(const Transmitor&) = delete;

  // Sends `request` and waits a few seconds for the reply, one line of at most
  // 16 MiB. Returns 0 when a reply arrived; negative when the service could not
  // be reached, did not answer in time or its reply line is longer.
  int Transmit(const Json::Value& request);

  // Fills `reply` with the reply to the last Transmit. Returns 0 on success;
  // negative when there is no reply or it is not JSON (`reply` left untouched).
  int GetDataJson(Json::Value& reply);

 private:
  struct Impl;
  Impl* impl_;
};

#endif  // KOVA_TRANSMITOR_H_
