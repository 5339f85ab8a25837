// Numbers as people read them: percentages, bytes and rates with binary
// prefixes, times in the browser's zone.

import {locale} from './i18n.js';

const kBinary = ['', 'Ki', 'Mi', 'Gi', 'Ti', 'Pi'];

// Formatters are made once: making one per call is slow, and charts call these
// for every label on every update.
const numberFormats = [];
const timeFormat = new Intl.DateTimeFormat(locale, {
  year: 'numeric', month: '2-digit', day: '2-digit',
  hour: '2-digit', minute: '2-digit', second: '2-digit',
});

const axisFormats = {
  second: new Intl.DateTimeFormat(locale, {hour: '2-digit', minute: '2-digit', second: '2-digit'}),
  minute: new Intl.DateTimeFormat(locale, {hour: '2-digit', minute: '2-digit'}),
  day: new Intl.DateTimeFormat(locale, {day: '2-digit', month: '2-digit'}),
};

function number(value, digits) {
  numberFormats[digits] ??= new Intl.NumberFormat(locale, {maximumFractionDigits: digits, minimumFractionDigits: 0});
  return numberFormats[digits].format(value);
}

// 1536 → "1.5 KiB"; `suffix` follows the prefix ("B", "B/s").
export function formatBinary(value, suffix = 'B') {
  if (!Number.isFinite(value)) return '–';
  let scaled = Math.abs(value);
  let step = 0;
  while (scaled >= 1024 && step < kBinary.length - 1) {
    scaled /= 1024;
    step += 1;
  }
  const digits = scaled >= 100 || step === 0 ? 0 : scaled >= 10 ? 1 : 2;
  return `${value < 0 ? '-' : ''}${number(scaled, digits)} ${kBinary[step]}${suffix}`;
}

// A value in a unit of the collector's catalog.
export function formatValue(value, unit) {
  if (value === null || value === undefined || !Number.isFinite(value)) return '–';
  switch (unit) {
    case '%':
      return `${number(value, value < 10 ? 1 : 0)} %`;
    case 'B':
      return formatBinary(value, 'B');
    case 'B/s':
      return formatBinary(value, 'B/s');
    case 'ms':
      return `${number(value, value < 10 ? 2 : 1)} ms`;
    case 'load':
      return number(value, 2);
    default:
      return `${number(value, value < 10 ? 1 : 0)} ${unit ?? ''}`.trim();
  }
}

// Unix seconds as local date and time, to the second.
export function formatTime(seconds) {
  return timeFormat.format(seconds * 1000);
}

// The labels of a time axis whose ticks lie `step` seconds apart: times of
// day, with the date under the first tick and under each tick of a new day;
// dates alone when ticks are days apart.
export function formatAxisTimes(ticks, step) {
  if (step >= 86400) return ticks.map((tick) => axisFormats.day.format(tick * 1000));
  const time = step < 60 ? axisFormats.second : axisFormats.minute;
  let day = '';
  return ticks.map((tick) => {
    const date = axisFormats.day.format(tick * 1000);
    const label = time.format(tick * 1000);
    if (date === day) return label;
    day = date;
    return `${label}\n${date}`;
  });
}

// A datetime-local input's value (the browser's zone) as Unix seconds; 0 when
// empty or not a time.
export function secondsOfInput(value) {
  const seconds = Math.floor(new Date(value).getTime() / 1000);
  return value && Number.isFinite(seconds) ? seconds : 0;
}

// Unix seconds as a datetime-local input's value, to the minute.
export function inputOfSeconds(seconds) {
  const date = new Date(seconds * 1000);
  date.setMinutes(date.getMinutes() - date.getTimezoneOffset());
  return date.toISOString().slice(0, 16);
}
