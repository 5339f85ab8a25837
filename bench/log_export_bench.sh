#!/usr/bin/env bash
# The event-log export over HTTP, in one run over a temporary system root:
#  - fills the performance-event log with EVENTS records (bench/log_fill: one
#    every three seconds, so that ordering by time is unique);
#  - downloads "KOVA.ResourceMonitor.Log" v1 `export` with type=csv and
#    type=html through kova-webapid with curl, 3 times each, and checks each
#    body byte for byte against a reference made apart from the module: the
#    log's text dump (`kova log dump`) sorted by time, newest first, framed by
#    awk as the export frames it;
#  - times `sqlite3 -csv` over the same records, imported from the same dump,
#    3 times, and gives the ratio of the export's median to it;
#  - the peak resident memory (VmHWM) of the ResourceMonitor's runner and of
#    the front-end during each download, reset before it where the kernel
#    allows (/proc/PID/clear_refs), else the peak since the process started.
# Targets: export <= 1.0x sqlite3 -csv, runner peak < 256 MiB, front-end peak
# < 32 MiB; reported, not enforced. Exits 1 when a check fails (a body that
# differs, a header missing, a host process not found).
#   bench/log_export_bench.sh [EVENTS]   (10^6 by default)
# Builds build/release first; run it on an otherwise idle machine.
set -euo pipefail
cd "$(dirname "$0")/.."
events=${1:-1000000}
[[ $events =~ ^[1-9][0-9]*$ ]] || { echo "usage: bench/log_export_bench.sh [EVENTS]" >&2; exit 2; }
command -v sqlite3 >/dev/null || { echo "sqlite3 is missing (scripts/setup installs it)" >&2; exit 2; }
. bench/host_root.sh
runs=3

fail() {
  echo "check failed: $*" >&2
  exit 1
}

# A call may take long on a large log: the export is measured, not cut short.
start_host log_fill -- --call-timeout 3600
# The store keeps the newest 10^5 records unless told to keep more.
echo "log_max_records=\"$events\"" >>"$root/etc/kovainfo.conf"
"$build/bench/log_fill" "$events"
echo "kova-webapid at ${url%/webapi/entry.cgi}, $(nproc) cores; $events events in the log (log_fill)"

# The host's processes: the monitor ($host) forks the front-end first, then a
# runner per module. All run the same program with the same command line, so
# the front-end is the child started first and the runner is the one that
# mapped the ResourceMonitor module.
children() { cat /proc/"$1"/task/*/children 2>/dev/null | tr ' ' '\n' | sed '/^$/d' || true; }
started() { sed 's/.*) //' /proc/"$1"/stat | awk '{print $20}'; }
front_end=$(for c in $(children "$host"); do echo "$(started "$c") $c"; done | sort -n -k1,1 -k2,2 |
  awk 'NR == 1 {print $2}')
runner=
for c in $(children "$host"); do
  if grep -q 'KOVA\.ResourceMonitor\.so' /proc/"$c"/maps 2>/dev/null; then runner=$c; fi
done
[ -n "$front_end" ] && [ -n "$runner" ] && [ "$front_end" != "$runner" ] ||
  fail "the front-end and the ResourceMonitor's runner are not among the host's processes"

# reset_peak PID: starts VmHWM over, when the kernel lets this user do it.
reset_peak() { echo 5 >/proc/"$1"/clear_refs 2>/dev/null || peak_since=start; }
peak_kib() { awk '/^VmHWM:/ {print $2}' /proc/"$1"/status; }
peak_since=download

# The reference. The dump prints id, level, time, user, source and the event
# (the rest of the line), separated by tabs.
"$build/platform/tools/kova" log dump >"$root/dump.tsv"
[ "$(wc -l <"$root/dump.tsv")" -eq "$events" ] || fail "the dump does not hold $events records"
LC_ALL=C sort -t "$(printf '\t')" -k3,3r "$root/dump.tsv" >"$root/sorted.tsv"
[ -z "$(cut -f3 "$root/sorted.tsv" | uniq -d | head -1)" ] || fail "two records share a time"
texts=$root/usr/share/kova/texts/enu/resourcemonitor.ini
title() { sed -n "s/^$1 = \"\\(.*\\)\"$/\\1/p" "$texts"; }
reference() {
  LC_ALL=C awk -F '\t' -v html="$1" -v t1="$(title log_time)" -v t2="$(title log_type)" \
    -v t3="$(title log_action)" '
    function cell(text) {
      if (html) {
        gsub(/&/, "\\&amp;", text); gsub(/</, "\\&lt;", text); gsub(/>/, "\\&gt;", text)
        gsub(/"/, "\\&quot;", text); gsub(/\047/, "\\&#39;", text)
        return "<td>" text "</td>"
      }
      if (index(text, ",") > 0) text = "\"" text "\""
      return text ","
    }
    function head(text) { return html ? "<th>" text "</th>" : text "," }
    BEGIN {
      end_row = html ? "</tr>\n" : "\r\n"
      if (html) printf "%s", "<html><head>\n<meta http-equiv=\"Content-Type\" " \
        "content=\"text/html; charset=utf-8;\">\n</head>\n<body>\n" \
        "<center><h2> ResourceMonitor </h2></center>\n"
    }
    NR == 1 {
      if (html) printf "%s", "<table border=1 width=95%>\n<tr>"
      printf "%s%s%s%s", head(t1), head(t2), head(t3), end_row
    }
    {
      event = $6
      for (i = 7; i <= NF; ++i) event = event "\t" $i
      printf "%s%s%s%s%s", html ? "<tr>" : "", cell($3), cell($2), cell(event), end_row
    }
    END {
      if (html && NR > 0) printf "%s", "</table>\n"
      if (html) printf "%s", "</body></html>"
    }' "$root/sorted.tsv"
}
reference 0 >"$root/expected.csv"
reference 1 >"$root/expected.html"

sqlite3 "$root/records.db" "CREATE TABLE records(id, level, time, user, source, event);" \
  ".mode tabs" ".import $root/dump.tsv records"
[ "$(sqlite3 "$root/records.db" 'SELECT count(*) FROM records')" -eq "$events" ] ||
  fail "sqlite3 did not import $events records"

now_ms() {
  local us=${EPOCHREALTIME/./}
  echo $((us / 1000))
}
# stats VALUES...: "min median max" of three or more numbers.
stats() { printf '%s\n' "$@" | sort -n | awk '{v[NR] = $1} END {print v[1], v[int((NR + 1) / 2)], v[NR]}'; }
median() { stats "$@" | awk '{print $2}'; }

sqlite_ms=()
for _ in $(seq "$runs"); do
  start=$(now_ms)
  sqlite3 -csv "$root/records.db" 'SELECT * FROM records' >"$root/sqlite.csv"
  sqlite_ms+=($(($(now_ms) - start)))
done
sqlite_median=$(median "${sqlite_ms[@]}")
echo "sqlite3 -csv of the same $events records: $(stats "${sqlite_ms[@]}") ms (min median max)," \
  "$(stat -c %s "$root/sqlite.csv") bytes"
echo

printf '%-5s %11s %23s %7s %9s %15s %17s\n' type bytes "export ms (min med max)" ratio \
  "target" "runner peak MiB" "front-end peak MiB"
worst_runner=0
worst_front=0
for type in csv html; do
  times=()
  runner_peak=0
  front_peak=0
  for _ in $(seq "$runs"); do
    reset_peak "$runner"
    reset_peak "$front_end"
    start=$(now_ms)
    code=$(curl -s -D "$root/headers" -o "$root/export.$type" -w '%{http_code}' \
      "$url?api=KOVA.ResourceMonitor.Log&version=1&method=export&type=$type&_sid=$sid")
    times+=($(($(now_ms) - start)))
    runner_peak=$(awk -v a="$runner_peak" -v b="$(peak_kib "$runner")" 'BEGIN {print (a > b ? a : b)}')
    front_peak=$(awk -v a="$front_peak" -v b="$(peak_kib "$front_end")" 'BEGIN {print (a > b ? a : b)}')
    [ "$code" = 200 ] || fail "export $type answered HTTP $code"
    grep -qi "^Content-Type: text/$type" "$root/headers" || fail "export $type: no Content-Type text/$type"
    grep -qi '^Content-Disposition:.*attachment; filename="ResourceMonitor-.*\.'"$type"'"' \
      "$root/headers" || fail "export $type: no Content-Disposition naming the file"
    length=$(sed -n 's/^Content-Length: \([0-9]*\).*/\1/ip' "$root/headers")
    [ "$length" = "$(stat -c %s "$root/export.$type")" ] || fail "export $type: Content-Length $length"
    cmp -s "$root/export.$type" "$root/expected.$type" ||
      fail "export $type differs from the reference: $(cmp "$root/export.$type" "$root/expected.$type" 2>&1 | head -1)"
  done
  ratio=$(awk -v e="$(median "${times[@]}")" -v s="$sqlite_median" 'BEGIN {printf "%.2f", e / (s > 0 ? s : 1)}')
  met=$(awk -v r="$ratio" 'BEGIN {print r <= 1.0 ? "met" : "not met"}')
  printf '%-5s %11s %23s %7s %9s %15s %17s\n' "$type" "$(stat -c %s "$root/export.$type")" \
    "$(stats "${times[@]}")" "${ratio}x" "$met" "$((runner_peak / 1024))" "$((front_peak / 1024))"
  worst_runner=$((runner_peak > worst_runner ? runner_peak : worst_runner))
  worst_front=$((front_peak > worst_front ? front_peak : worst_front))
  rm -f "$root/export.$type"
done
echo
echo "every body equals its reference byte for byte; peaks are VmHWM since each download" \
  "started$([ "$peak_since" = download ] || echo " (clear_refs refused: since the process started)")"
echo "targets: export <= 1.0x sqlite3 -csv; runner peak $((worst_runner / 1024)) MiB" \
  "($([ "$worst_runner" -lt $((256 * 1024)) ] && echo met || echo not met) < 256 MiB);" \
  "front-end peak $((worst_front / 1024)) MiB" \
  "($([ "$worst_front" -lt $((32 * 1024)) ] && echo met || echo not met) < 32 MiB)"
