// The statistics of "KOVA.ResourceMonitor.Usage" and the events of the
// performance-event log, as the charts need them.

import {call} from './api.js';

const kUsage = 'KOVA.ResourceMonitor.Usage';
const kMaxSeriesPerCall = 64;  // the collector's limit of one request
const kCatalogSeconds = 10;

let catalogCache = null;
let catalogTime = 0;
let clockSkew = 0;  // the collector's clock less the browser's, from its last answer

// Unix seconds on the collector's clock, as far as its answers tell, so that a
// browser whose clock is off still asks for the samples that exist.
export function collectorNow() {
  return Math.floor(Date.now() / 1000 + clockSkew);
}

// The collector's catalog, read again when older than 10 s or when `fresh`.
export async function catalog({fresh = false} = {}) {
  const now = Date.now() / 1000;
  if (fresh || !catalogCache || now - catalogTime > kCatalogSeconds) {
    catalogCache = await call(kUsage, 'catalog');
    catalogTime = now;
  }
  return catalogCache;
}

function chunks(ids) {
  const parts = [];
  for (let i = 0; i < ids.length; i += kMaxSeriesPerCall) parts.push(ids.slice(i, i + kMaxSeriesPerCall));
  return parts;
}

// The samples of `ids` after `since`: {now, series: Map id → {times, values}}.
// More than 64 ids go in several calls at once.
export async function realtime(ids, since = 0) {
  const answers = await Promise.all(chunks(ids).map((part) => call(kUsage, 'realtime', {series: part, since})));
  const series = new Map();
  let now = 0;
  for (const answer of answers) {
    now = Math.max(now, answer.now ?? 0);
    for (const one of answer.series) series.set(one.id, one);
  }
  if (now > 0) clockSkew = now - Date.now() / 1000;
  return {now, series};
}

// `ids` between `from` and `to` in at most `points` points:
// {step, source, series: Map id → {times, avg, min, max}}.
export async function history(ids, from, to, points) {
  const answers = await Promise.all(chunks(ids).map((part) => call(kUsage, 'history', {series: part, from, to, points})));
  const series = new Map();
  for (const answer of answers) for (const one of answer.series) series.set(one.id, one);
  return {step: answers[0]?.step ?? 0, source: answers[0]?.source ?? '', series};
}

// A time of the log ("2026/11/24 13:07:09", the server's local time) as Unix
// seconds, with the server's offset from UTC; NaN when it isn't one.
export function logTimeToSeconds(text, utcOffset) {
  const match = /^(\d{4})\/(\d{2})\/(\d{2}) (\d{2}):(\d{2}):(\d{2})$/.exec(text);
  if (!match) return NaN;
  const [, year, month, day, hour, minute, second] = match.map(Number);
  return Date.UTC(year, month - 1, day, hour, minute, second) / 1000 - utcOffset;
}

// The performance events between `from` and `to` (Unix seconds), newest first,
// at most `limit`: [{time, level, text}].
export async function events(from, to, utcOffset, limit = 200) {
  const answer = await call('KOVA.ResourceMonitor.Log', 'list', {
    offset: 0, limit, filter: {datefrom: Math.floor(from), dateto: Math.ceil(to)},
  });
  return answer.logs
    .map((entry) => ({time: logTimeToSeconds(entry.time, utcOffset), level: entry.level, text: entry.event}))
    .filter((event) => Number.isFinite(event.time));
}
