// An error of a call in words. Some errors name their text in the system's
// string tables ("err_session", "err_key"); the others are the app's own, by
// code.

import {ApiError} from './api.js';
import {define, systemText, t} from './i18n.js';

define({
  enu: {
    'error.0': 'The server can not be reached.',
    'error.100': 'The server failed to carry out the request.',
    'error.101': 'The server refused a value of the request.',
    'error.105': 'Only an administrator may do this.',
    'error.106': 'You are not signed in.',
    'error.107': 'Your session is no longer valid.',
    'error.108': 'Wrong account name or password.',
    'error.109': 'Too many failed sign-ins. Try again in {seconds} seconds.',
    'error.6101': 'A setting has a value of the wrong kind.',
    'error.6102': 'The system settings or rules could not be read or written.',
    'error.6103': 'No volume holds the history database.',
    'error.6104': 'The history database is not running.',
    'error.6105': 'The statistics collector did not confirm the change.',
    'error.6106': 'A rule for this object, resource and severity exists already.',
    'error.6107': 'The rule no longer exists.',
    'error.other': 'The request failed (error {code}).',
  },
  ger: {
    'error.0': 'Der Server ist nicht erreichbar.',
    'error.100': 'Der Server konnte die Anfrage nicht ausführen.',
    'error.101': 'Der Server hat einen Wert der Anfrage abgelehnt.',
    'error.105': 'Nur ein Administrator darf das.',
    'error.106': 'Sie sind nicht angemeldet.',
    'error.107': 'Ihre Sitzung ist nicht mehr gültig.',
    'error.108': 'Falscher Kontoname oder falsches Passwort.',
    'error.109': 'Zu viele fehlgeschlagene Anmeldungen. Versuchen Sie es in {seconds} Sekunden erneut.',
    'error.6101': 'Eine Einstellung hat einen Wert der falschen Art.',
    'error.6102': 'Die Systemeinstellungen oder Regeln konnten nicht gelesen oder geschrieben werden.',
    'error.6103': 'Kein Volume enthält die Verlaufsdatenbank.',
    'error.6104': 'Die Verlaufsdatenbank läuft nicht.',
    'error.6105': 'Der Statistikdienst hat die Änderung nicht bestätigt.',
    'error.6106': 'Eine Regel für dieses Objekt, diese Ressource und diesen Schweregrad gibt es schon.',
    'error.6107': 'Die Regel existiert nicht mehr.',
    'error.other': 'Die Anfrage ist fehlgeschlagen (Fehler {code}).',
  },
});

// Codes whose answer always names its own text. The resource monitor's error
// record is kept across calls, so with other codes the names can be left over
// from an earlier failure and say something else.
const kCodesWithOwnText = new Set([6103, 6104, 6201, 6202, 6203, 6204]);

// The words for `error`, an ApiError or any other thrown value.
export function errorText(error) {
  const errors = error?.errors;
  if (kCodesWithOwnText.has(error?.code) && errors?.err_session && errors?.err_key) {
    const text = systemText(errors.err_session, errors.err_key);
    if (text) return text;
    if (errors.err_msg && errors.err_session === 'usage') return errors.err_msg;
  }
  const code = typeof error?.code === 'number' ? error.code : 0;
  const key = `error.${code}`;
  const text = t(key, {seconds: errors?.retry_after ?? '', code});
  return text === key ? t('error.other', {code}) : text;
}

// Shows the words for a failed call in `notice`. Anything but an ApiError is
// a fault of the page itself, for the console.
export function showCallError(notice, error) {
  if (!(error instanceof ApiError)) {
    console.error(error);
    return;
  }
  notice.textContent = errorText(error);
  notice.hidden = false;
}
