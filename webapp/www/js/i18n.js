// The app's language and texts. English and German, chosen by the browser's
// languages as the host chooses them. The app's own texts are tables of the
// modules that use them; the system's texts (the modules' error texts) come
// from the platform's string tables, put in texts/<language>.json by the build.

export const language = pickLanguage(navigator.languages ?? [navigator.language]);
// The locale for dates and numbers: the browser's own when it speaks the language.
export const locale =
  (navigator.languages ?? []).find((tag) => tag.startsWith(language === 'ger' ? 'de' : 'en')) ??
  (language === 'ger' ? 'de-DE' : 'en-GB');

const own = {};
let system = {};

function pickLanguage(tags) {
  for (const tag of tags) {
    const primary = String(tag).toLowerCase().split('-')[0];
    if (primary === 'de') return 'ger';
    if (primary === 'en') return 'enu';
  }
  return 'enu';
}

// Adds a table of texts: {enu: {key: text}, ger: {key: text}}. A key missing in
// German falls back to English.
export function define(table) {
  for (const [key, text] of Object.entries(table.enu)) own[key] = text;
  if (language === 'ger') Object.assign(own, table.ger ?? {});
}

// The text of `key`, with {name} filled from `values`; the key itself when unknown.
export function t(key, values = {}) {
  const text = own[key] ?? key;
  return text.replace(/\{(\w+)\}/g, (match, name) => (name in values ? String(values[name]) : match));
}

// Reads the system's texts once; the app goes on with its own when they can't be read.
export async function loadSystemTexts() {
  try {
    const reply = await fetch(`texts/${language}.json`);
    if (reply.ok) system = await reply.json();
  } catch {
    system = {};
  }
}

// A text of the system's string tables, or undefined.
export function systemText(section, key) {
  return system[section]?.[key];
}

document.documentElement.lang = language === 'ger' ? 'de' : 'en';
