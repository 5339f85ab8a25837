#include <time.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

#include "api/error_report.h"
#include "api/module.h"
#include "kova/text.h"
#include "log/log_handlers.h"
#include "log/log_reader.h"

namespace {

constexpr char kTitle[] = "ResourceMonitor";

// How a download is framed. Every text is written as it stands.
struct ExportFormat {
  const char* type;  // the "type" parameter and the file name's extension
  const char* content_type;
  const char* page_start;  // after the HTTP header, whether or not there are entries
  const char* table_start;
  const char* row_start;
  const char* header_open;
  const char* header_close;
  const char* cell_open;
  const char* cell_close;
  const char* row_end;
  const char* table_end;
  const char* page_end;
  bool html;
};

constexpr ExportFormat kFormats[] = {
    {"html", "text/html",
     "<html><head>\n"
     "<meta http-equiv=\"Content-Type\" content=\"text/html; charset=utf-8;\">\n"
     "</head>\n"
     "<body>\n"
     "<center><h2> ResourceMonitor </h2></center>\n",
     "<table border=1 width=95%>\n", "<tr>", "<th>", "</th>", "<td>", "</td>", "</tr>\n",
     "</table>\n", "</body></html>", true},
    {"csv", "text/csv", "", "", "", "", ",", "", ",", "\r\n", "", "", false},
    {},
};

// The columns: the bundle key of the header text and the entry member.
struct ExportColumn {
  const char* title_key;
  std::string_view LogFields::*member;
};

constexpr ExportColumn kColumns[] = {
    {"log_time", &LogFields::time},
    {"log_type", &LogFields::level},
    {"log_action", &LogFields::event},
    {},
};

const ExportFormat* FindFormat(const Json::Value& type) {
  if (!type.isString()) return nullptr;
  for (const ExportFormat* format = kFormats; format->type != nullptr; ++format) {
    if (type.asString() == format->type) return format;
  }
  return nullptr;
}

void Print(const char* text) { fputs_unlocked(text, stdout); }

void Print(std::string_view text) { fwrite_unlocked(text.data(), 1, text.size(), stdout); }

bool IsAscii(std::string_view text) {
  for (const char c : text) {
    if (static_cast<unsigned char>(c) >= 0x80) return false;
  }
  return true;
}

// Writes one data cell as FormatExportCell makes it, without a copy for the
// common cell: upper-casing ASCII adds or removes no comma, so a search for
// one decides the quotes.
void PrintCell(bool html, std::string_view text, std::string& scratch) {
  if (!html && IsAscii(text)) {
    const bool quoted = memchr(text.data(), ',', text.size()) != nullptr;
    if (quoted) Print("\"");
    Print(text);
    if (quoted) Print("\"");
    return;
  }
  scratch.assign(text);
  Print(FormatExportCell(html, scratch));
}

// "ResourceMonitor-<local time of the request>.<type>".
std::string DownloadName(const char* type) {
  char stamp[64];
  char name[1024];
  memset(stamp, 0, sizeof(stamp));
  memset(name, 0, sizeof(name));
  const time_t now = time(nullptr);
  struct tm local;
  if (localtime_r(&now, &local) != nullptr) {
    strftime(stamp, sizeof(stamp), "%Y-%m-%d-%H-%M-%S", &local);
  }
  snprintf(name, sizeof(name), "%s-%s.%s", kTitle, stamp, type);
  return name;
}

// Writes the HTTP header lines and the body to standard output, then flushes it.
void WriteDownload(const ExportFormat& format, const LogRecords& entries) {
  const std::string name = DownloadName(format.type);
  printf("Content-Type: %s\r\n", format.content_type);
  printf("Content-Disposition:attachment; filename=\"%s\"\r\n\r\n",
         WebUtils::EncodeURL(name).c_str());
  Print(format.page_start);
  if (entries.size() > 0) {
    Print(format.table_start);
    Print(format.row_start);
    for (const ExportColumn* column = kColumns; column->title_key != nullptr; ++column) {
      Print(format.header_open);
      Print(gStringBundle.Text(column->title_key, ""));
      Print(format.header_close);
    }
    Print(format.row_end);
    std::string scratch;
    for (size_t i = 0; i < entries.size(); ++i) {
      const LogFields fields = entries.Fields(i);
      Print(format.row_start);
      for (const ExportColumn* column = kColumns; column->title_key != nullptr; ++column) {
        Print(format.cell_open);
        PrintCell(format.html, fields.*column->member, scratch);
        Print(format.cell_close);
      }
      Print(format.row_end);
    }
    Print(format.table_end);
  }
  Print(format.page_end);
  fflush(stdout);
}

}  // namespace

std::string FormatExportCell(bool html, const std::string& text) {
  if (html) return WebUtils::EncodeHtml(text, true);
  // Only a comma makes a cell quoted; quotes and line breaks inside stay as they are.
  if (ContainsIgnoreCase(text, ",")) return "\"" + text + "\"";
  return text;
}

void log_export_v1(KOVA::APIRequest* request, KOVA::APIResponse* response) {
  LogFilter filter;
  if (!ParseLogFilter(request->GetParam("filter", Json::Value()), 0, -1, filter)) {
    return response->SetError(kErrorBadParameter, Json::Value());
  }
  const ExportFormat* format = FindFormat(request->GetParam("type", Json::Value()));
  if (format == nullptr) return response->SetError(kErrorBadParameter, Json::Value());
  LogRecords entries;
  ProcessLogRecords(filter, entries);  // an unreadable log is exported as an empty one
  response->SetEnableOutput(false);
  WriteDownload(*format, entries);
}
