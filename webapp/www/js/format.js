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
