// The settings screen: the reach of the real-time charts, history recording
// and performance events. Apply sends only what changed; the form then shows
// what the server really stored, also after a failure, since a failed change
// may have applied the settings before it.

import {call} from '../api.js';
import {errorText} from '../errors.js';
import {define, t} from '../i18n.js';
import {h, showStatus} from '../ui.js';
import {catalog} from '../usage.js';

define({
  enu: {
    'settings.form': 'Resource monitor settings',
    'settings.duration': 'Real-time range',
    'settings.minutes': '{minutes} minutes',
    'settings.duration_hint': 'How far back the real-time charts reach.',
    'settings.history': 'Record history',
    'settings.history_hint': 'Keeps the statistics in the history database.',
    'settings.event': 'Performance events',
    'settings.event_hint': 'Watches the event rules and writes what they find to the event log.',
    'settings.apply': 'Apply',
    'settings.saved': 'The settings have been saved.',
  },
  ger: {
    'settings.form': 'Einstellungen des Ressourcenmonitors',
    'settings.duration': 'Echtzeitbereich',
    'settings.minutes': '{minutes} Minuten',
    'settings.duration_hint': 'Wie weit die Echtzeitdiagramme zurückreichen.',
    'settings.history': 'Verlauf aufzeichnen',
    'settings.history_hint': 'Speichert die Statistiken in der Verlaufsdatenbank.',
    'settings.event': 'Leistungsereignisse',
    'settings.event_hint': 'Überwacht die Ereignisregeln und schreibt, was sie finden, ins Ereignisprotokoll.',
    'settings.apply': 'Übernehmen',
    'settings.saved': 'Die Einstellungen wurden gespeichert.',
  },
});

const kSetting = 'KOVA.ResourceMonitor.Setting';
const kDurations = [15, 30, 60, 120];

function option(minutes) {
  return h('option', {value: String(minutes)}, t('settings.minutes', {minutes}));
}

export async function mount(container) {
  let stored = null;  // the last answer of "get"
  let gone = false;

  const duration = h('select', {id: 'settings-duration', name: 'duration',
                                'aria-describedby': 'settings-duration-hint'}, kDurations.map(option));
  const history = h('input', {type: 'checkbox', role: 'switch', id: 'settings-history', name: 'enable_history',
                              'aria-describedby': 'settings-history-hint'});
  const event = h('input', {type: 'checkbox', role: 'switch', id: 'settings-event', name: 'enable_event',
                            'aria-describedby': 'settings-event-hint'});
  const alert = h('p', {class: 'error', role: 'alert'});
  const apply = h('button', {class: 'primary', disabled: true}, t('settings.apply'));
  // Disabled while the settings are read or applied.
  const fields = h('fieldset', {disabled: true},
    h('div', {class: 'field'},
      h('label', {for: 'settings-duration'}, t('settings.duration')), duration,
      h('span', {id: 'settings-duration-hint', class: 'muted'}, t('settings.duration_hint'))),
    h('div', {class: 'switch'}, history,
      h('label', {for: 'settings-history'}, t('settings.history')),
      h('span', {id: 'settings-history-hint', class: 'muted'}, t('settings.history_hint'))),
    h('div', {class: 'switch'}, event,
      h('label', {for: 'settings-event'}, t('settings.event')),
      h('span', {id: 'settings-event-hint', class: 'muted'}, t('settings.event_hint'))),
    alert,
    h('div', {class: 'buttons'}, apply));
  const form = h('form', {class: 'card settings-form', 'aria-label': t('settings.form'),
                          onchange: () => (apply.disabled = !Object.keys(changes()).length),
                          onsubmit: submit}, fields);
  container.append(form);

  // What differs from the stored settings, as the parameters of "set".
  function changes() {
    const changed = {};
    if (Number(duration.value) !== stored.duration) changed.duration = Number(duration.value);
    if (history.checked !== stored.enable_history) changed.enable_history = history.checked;
    if (event.checked !== stored.enable_event) changed.enable_event = event.checked;
    return changed;
  }

  async function read() {
    const answer = await call(kSetting, 'get');
    if (gone) return;
    stored = answer;
    // A range stored outside the steps is shown as it is.
    if (!duration.querySelector(`option[value="${answer.duration}"]`)) duration.append(option(answer.duration));
    duration.value = String(answer.duration);
    history.checked = answer.enable_history;
    event.checked = answer.enable_event;
    apply.disabled = true;
    fields.disabled = false;
    // Disabling the form took the focus from Apply; it goes back to the form.
    if (!gone && document.activeElement === document.body) (apply.disabled ? fields.querySelector('select') : apply)?.focus();
  }

  async function submit(submitted) {
    submitted.preventDefault();
    const changed = changes();
    if (!Object.keys(changed).length) return;
    fields.disabled = true;
    alert.textContent = '';
    showStatus('');
    let failure = null;
    try {
      await call(kSetting, 'set', changed);
      if (!gone) showStatus(t('settings.saved'));
      // The charts take the new reach from the catalog at once.
      catalog({fresh: true}).catch(() => {});
    } catch (error) {
      failure = error;
    }
    try {
      await read();
    } catch (error) {
      failure ??= error;
    }
    if (failure && !gone) {
      alert.textContent = errorText(failure);
      apply.disabled = !Object.keys(changes()).length;
    }
    fields.disabled = false;
    // Disabling the form took the focus from Apply; it goes back to the form.
    if (!gone && document.activeElement === document.body) (apply.disabled ? fields.querySelector('select') : apply)?.focus();
  }

  try {
    await read();
  } catch (error) {
    alert.textContent = errorText(error);
  }
  return {
    unmount() {
      gone = true;
    },
  };
}
