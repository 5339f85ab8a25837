// The event log screen: the performance events, newest first, a page at a
// time, filtered by level, time range and keyword; export and clear.

import {call, download} from '../api.js';
import {errorText} from '../errors.js';
import {formatTime, secondsOfInput} from '../format.js';
import {define, t} from '../i18n.js';
import {confirmDialog, h, showStatus} from '../ui.js';
import {catalog, logTimeToSeconds} from '../usage.js';

define({
  enu: {
    'log.filters': 'Filter events',
    'log.level': 'Level',
    'log.level_all': 'All levels',
    'log.level_Info': 'Information',
    'log.level_Warning': 'Warning',
    'log.level_Critical': 'Critical',
    'log.from': 'From',
    'log.to': 'To',
    'log.keyword': 'Keyword',
    'log.search': 'Search',
    'log.actions': 'Log actions',
    'log.export_csv': 'Export CSV',
    'log.export_html': 'Export HTML',
    'log.clear': 'Clear log',
    'log.clear_question': 'Delete every event of the log? This can not be undone.',
    'log.cleared': 'The event log has been cleared.',
    'log.table': 'Performance events',
    'log.time': 'Time',
    'log.event': 'Event',
    'log.empty': 'No events',
    'log.empty_filtered': 'No events match the filter.',
    'log.pages': 'Pages',
    'log.previous': 'Previous',
    'log.next': 'Next',
    'log.range': '{first}–{last} of {total}',
  },
  ger: {
    'log.filters': 'Ereignisse filtern',
    'log.level': 'Stufe',
    'log.level_all': 'Alle Stufen',
    'log.level_Info': 'Information',
    'log.level_Warning': 'Warnung',
    'log.level_Critical': 'Kritisch',
    'log.from': 'Von',
    'log.to': 'Bis',
    'log.keyword': 'Suchbegriff',
    'log.search': 'Suchen',
    'log.actions': 'Protokollaktionen',
    'log.export_csv': 'Als CSV exportieren',
    'log.export_html': 'Als HTML exportieren',
    'log.clear': 'Protokoll leeren',
    'log.clear_question': 'Alle Ereignisse des Protokolls löschen? Das lässt sich nicht rückgängig machen.',
    'log.cleared': 'Das Ereignisprotokoll wurde geleert.',
    'log.table': 'Leistungsereignisse',
    'log.time': 'Zeit',
    'log.event': 'Ereignis',
    'log.empty': 'Keine Ereignisse',
    'log.empty_filtered': 'Keine Ereignisse entsprechen dem Filter.',
    'log.pages': 'Seiten',
    'log.previous': 'Zurück',
    'log.next': 'Weiter',
    'log.range': '{first}–{last} von {total}',
  },
});

const kLog = 'KOVA.ResourceMonitor.Log';
const kPageSize = 25;

function levelName(level) {
  const key = `log.level_${level}`;
  return t(key) === key ? level : t(key);
}

function field(id, label, control) {
  control.id = id;
  return h('div', {class: 'field'}, h('label', {for: id}, label), control);
}

export async function mount(container) {
  let offset = 0;
  let asked = 0;  // numbers the reads, so that only the last one is shown
  let utcOffset = null;

  const level = h('select', {name: 'loglevel'},
    h('option', {value: ''}, t('log.level_all')),
    h('option', {value: 'Warning'}, t('log.level_Warning')),
    h('option', {value: 'Critical'}, t('log.level_Critical')));
  const from = h('input', {type: 'datetime-local', name: 'datefrom', step: '1'});
  const to = h('input', {type: 'datetime-local', name: 'dateto', step: '1'});
  // The keyword applies on Enter or Search, and at once when it is emptied.
  const keyword = h('input', {type: 'search', name: 'keyword', autocomplete: 'off',
                              oninput: () => keyword.value === '' && search()});
  const filters = h('form', {class: 'toolbar log-filters', role: 'search', 'aria-label': t('log.filters'),
                             onchange: (event) => event.target !== keyword && search(),
                             onsubmit: (event) => {
                               event.preventDefault();
                               search();
                             }},
    field('log-level', t('log.level'), level),
    field('log-from', t('log.from'), from),
    field('log-to', t('log.to'), to),
    field('log-keyword', t('log.keyword'), keyword),
    h('button', {class: 'primary'}, t('log.search')));

  const actions = h('div', {class: 'toolbar log-actions', role: 'group', 'aria-label': t('log.actions')},
    h('button', {type: 'button', onclick: () => exportAs('csv')}, t('log.export_csv')),
    h('button', {type: 'button', onclick: () => exportAs('html')}, t('log.export_html')),
    h('button', {type: 'button', class: 'danger', onclick: clear}, t('log.clear')));

  const rows = h('tbody');
  const table = h('table', {class: 'log-table', 'aria-label': t('log.table')},
    h('thead', {}, h('tr', {},
      h('th', {scope: 'col'}, t('log.time')),
      h('th', {scope: 'col'}, t('log.level')),
      h('th', {scope: 'col'}, t('log.event')))),
    rows);
  const alert = h('p', {class: 'error', role: 'alert'});
  const range = h('span', {class: 'log-range', 'aria-live': 'polite'});
  const previous = h('button', {type: 'button', onclick: () => turn(-kPageSize)}, t('log.previous'));
  const next = h('button', {type: 'button', onclick: () => turn(kPageSize)}, t('log.next'));
  const pager = h('nav', {class: 'pager', 'aria-label': t('log.pages')}, previous, range, next);

  container.append(filters, actions, alert, h('div', {class: 'table-wrap'}, table), pager);

  function filter() {
    const chosen = {};
    if (level.value) chosen.loglevel = level.value;
    const datefrom = secondsOfInput(from.value);
    const dateto = secondsOfInput(to.value);
    if (datefrom) chosen.datefrom = datefrom;
    if (dateto) chosen.dateto = dateto;
    if (keyword.value.trim()) chosen.keyword = keyword.value.trim();
    return chosen;
  }

  function timeCell(text) {
    const seconds = utcOffset === null ? NaN : logTimeToSeconds(text, utcOffset);
    if (!Number.isFinite(seconds)) return h('td', {class: 'log-time'}, text);
    return h('td', {class: 'log-time'},
      h('time', {datetime: new Date(seconds * 1000).toISOString()}, formatTime(seconds)));
  }

  function show(answer, filtered) {
    const logs = answer.logs ?? [];
    const total = answer.total ?? 0;
    rows.replaceChildren(...logs.map((entry) => h('tr', {},
      timeCell(entry.time),
      h('td', {}, h('span', {class: `level level-${entry.level}`}, levelName(entry.level))),
      h('td', {class: 'log-event'}, entry.event))));
    if (!logs.length) {
      rows.append(h('tr', {}, h('td', {colspan: '3', class: 'muted'},
        t(filtered ? 'log.empty_filtered' : 'log.empty'))));
    }
    pager.hidden = total === 0;
    range.textContent = t('log.range', {first: offset + 1, last: offset + logs.length, total});
    const focused = document.activeElement;
    previous.disabled = offset === 0;
    next.disabled = offset + logs.length >= total;
    // Keyboard focus stays in the pager when the end is reached.
    if (focused === next && next.disabled) previous.focus();
    if (focused === previous && previous.disabled) next.focus();
  }

  async function load() {
    const mine = ++asked;
    const chosen = filter();
    table.setAttribute('aria-busy', 'true');
    try {
      const answer = await call(kLog, 'list', {offset, limit: kPageSize, filter: chosen});
      if (mine !== asked) return;
      // The log shrank under the page: show its last page instead.
      if (!answer.logs?.length && offset > 0 && answer.total > 0) {
        offset = Math.floor((answer.total - 1) / kPageSize) * kPageSize;
        return load();
      }
      alert.textContent = '';
      show(answer, Object.keys(chosen).length > 0);
    } catch (error) {
      if (mine === asked) alert.textContent = errorText(error);
    } finally {
      if (mine === asked) table.removeAttribute('aria-busy');
    }
  }

  function search() {
    offset = 0;
    return load();
  }

  function turn(step) {
    offset = Math.max(0, offset + step);
    load();
  }

  async function exportAs(type) {
    try {
      await download(kLog, 'export', {type, filter: filter()});
    } catch (error) {
      showStatus(errorText(error), {error: true});
    }
  }

  async function clear() {
    if (!await confirmDialog(t('log.clear_question'), t('log.clear'))) return;
    try {
      await call(kLog, 'clear');
      showStatus(t('log.cleared'));
    } catch (error) {
      showStatus(errorText(error), {error: true});
    }
    await search();
  }

  // Times are shown in the browser's zone when the server's offset is known.
  try {
    const answer = await catalog();
    if (Number.isFinite(answer?.utc_offset)) utcOffset = answer.utc_offset;
  } catch {
    // The server's own times are shown then.
  }
  await load();
  return {
    unmount() {
      asked += 1;
    },
  };
}
