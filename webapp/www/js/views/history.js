// The history screen: usage over the last hour, day, week, month or a chosen
// stretch, from the history database, with its newest minutes from the
// collector's real-time samples so that the lines run up to now. Averages in
// min/max bands; dragging over a chart zooms in.

import {createChart} from '../chart.js';
import {errorText} from '../errors.js';
import {formatTime, inputOfSeconds, secondsOfInput} from '../format.js';
import {complement, joinSeries, sumSeries} from '../history-data.js';
import {define, t} from '../i18n.js';
import {h, startPolling} from '../ui.js';
import {catalog, history, realtime} from '../usage.js';

define({
  enu: {
    'history.ranges': 'Time range',
    'history.range.hour': 'Last hour',
    'history.range.day': 'Last day',
    'history.range.week': 'Last week',
    'history.range.month': 'Last month',
    'history.range.custom': 'Custom',
    'history.from': 'From',
    'history.to': 'To',
    'history.apply': 'Show',
    'history.bad_range': 'Enter a start that comes before the end.',
    'history.short_range': 'Choose a range of at least {seconds} seconds.',
    'history.zoom_out': 'Zoom out',
    'history.zoom_reset': 'Reset zoom',
    'history.hint': 'Drag across a chart to zoom in, or type a range under {custom}.',
    'history.caption': '{from} – {to} · history in steps of {step}',
    'history.empty': '{from} – {to} · no usage was recorded in this time.',
    'history.loading': 'Loading…',
    'history.chart.cpu': 'CPU',
    'history.chart.memory': 'Memory',
    'history.chart.network': 'Network',
    'history.chart.disk': 'Disks',
    'history.line.busy': 'In use',
    'history.line.iowait': 'I/O wait',
    'history.line.used': 'Used',
    'history.line.swap': 'Swap',
    'history.line.received': 'Received',
    'history.line.sent': 'Sent',
    'history.line.read': 'Read',
    'history.line.written': 'Written',
    'history.pick.interface': 'Interface',
    'history.pick.device': 'Disk',
    'history.all.interface': 'All interfaces',
    'history.all.device': 'All disks',
    'history.off': 'Usage history is switched off.',
    'history.off_more': 'Switch it on in the settings to keep usage for days, weeks and months.',
    'history.database': 'The history database can\'t be reached.',
    'history.database_more': 'The statistics collector keeps new usage until the database is back.',
    'history.settings': 'Open the settings',
    'history.retry': 'The screen tries again every few seconds.',
  },
  ger: {
    'history.ranges': 'Zeitraum',
    'history.range.hour': 'Letzte Stunde',
    'history.range.day': 'Letzter Tag',
    'history.range.week': 'Letzte Woche',
    'history.range.month': 'Letzter Monat',
    'history.range.custom': 'Benutzerdefiniert',
    'history.from': 'Von',
    'history.to': 'Bis',
    'history.apply': 'Anzeigen',
    'history.bad_range': 'Geben Sie einen Beginn vor dem Ende ein.',
    'history.short_range': 'Wählen Sie einen Bereich von mindestens {seconds} Sekunden.',
    'history.zoom_out': 'Herauszoomen',
    'history.zoom_reset': 'Zoom zurücksetzen',
    'history.hint': 'Ziehen Sie über ein Diagramm, um hineinzuzoomen, oder geben Sie unter {custom} einen Bereich ein.',
    'history.caption': '{from} – {to} · Verlauf in Schritten von {step}',
    'history.empty': '{from} – {to} · in dieser Zeit wurde keine Nutzung aufgezeichnet.',
    'history.loading': 'Wird geladen …',
    'history.chart.cpu': 'CPU',
    'history.chart.memory': 'Arbeitsspeicher',
    'history.chart.network': 'Netzwerk',
    'history.chart.disk': 'Datenträger',
    'history.line.busy': 'Ausgelastet',
    'history.line.iowait': 'E/A-Wartezeit',
    'history.line.used': 'Belegt',
    'history.line.swap': 'Auslagerung',
    'history.line.received': 'Empfangen',
    'history.line.sent': 'Gesendet',
    'history.line.read': 'Gelesen',
    'history.line.written': 'Geschrieben',
    'history.pick.interface': 'Schnittstelle',
    'history.pick.device': 'Datenträger',
    'history.all.interface': 'Alle Schnittstellen',
    'history.all.device': 'Alle Datenträger',
    'history.off': 'Der Nutzungsverlauf ist ausgeschaltet.',
    'history.off_more': 'Schalten Sie ihn in den Einstellungen ein, um die Nutzung über Tage, Wochen und Monate aufzubewahren.',
    'history.database': 'Die Verlaufsdatenbank ist nicht erreichbar.',
    'history.database_more': 'Der Statistikdienst bewahrt neue Werte auf, bis die Datenbank wieder erreichbar ist.',
    'history.settings': 'Einstellungen öffnen',
    'history.retry': 'Die Ansicht versucht es alle paar Sekunden erneut.',
  },
});

const kSpans = {hour: 3600, day: 86400, week: 7 * 86400, month: 30 * 86400};
const kTickMs = 5000;
const kMinSpan = 60;   // seconds: the narrowest zoom
const kMaxPoints = 10000;

// The charts. A chart with `pick` has a line per metric over all objects of
// that label (summed) or the one chosen; `flip` draws 100 less the value.
const kCharts = [
  {id: 'cpu', unit: '%', yRange: [0, 100],
   lines: [{metric: 'cpu.idle', label: 'busy', flip: true}, {metric: 'cpu.iowait', label: 'iowait'}]},
  {id: 'memory', unit: 'B',
   lines: [{metric: 'mem.used', label: 'used'}, {metric: 'swap.used', label: 'swap'}]},
  {id: 'network', unit: 'B/s', pick: 'interface',
   lines: [{metric: 'net.rx_bytes', label: 'received'}, {metric: 'net.tx_bytes', label: 'sent'}]},
  {id: 'disk', unit: 'B/s', pick: 'device',
   lines: [{metric: 'disk.read_bytes', label: 'read'}, {metric: 'disk.write_bytes', label: 'written'}]},
];

// The kind of trouble an error of the Usage API is.
function troubleOf(error) {
  return {6201: 'collector', 6202: 'off', 6203: 'database'}[error?.code] ?? 'failed';
}

// A step of the history: whole minutes or whole hours.
function stepText(seconds) {
  return seconds % 3600 === 0 ? `${seconds / 3600} h` : `${Math.round(seconds / 60)} min`;
}

export function mount(container) {
  let stopped = false;
  let info = null;          // the collector's catalog
  let preset = 'hour';      // a key of kSpans, or 'custom'
  let shown = null;         // {from, to} of the charts; for a preset, set by each load
  let zooms = [];           // the windows zoomed in from, newest last
  let loads = 0;            // counts loads: only the newest one is drawn
  let loaded = 0;           // when the last load ended (ms); 0: one is needed
  let trouble = '';         // what the notice says, '' when the charts show
  let last = null;          // the data drawn, kept for a change of interface or disk
  const live = {now: 0, series: new Map()};  // real-time samples, the newest minutes
  const charts = [];

  const rangeButtons = Object.keys(kSpans).map((key) => h('button',
    {type: 'button', dataset: {range: key}, onclick: () => choose(key)}, t(`history.range.${key}`)));
  const customButton = h('button', {type: 'button', dataset: {range: 'custom'}, onclick: toggleCustom,
                                    'aria-controls': 'history-custom', 'aria-expanded': 'false'},
                         t('history.range.custom'));
  const fromInput = h('input', {type: 'datetime-local', id: 'history-from', required: true});
  const toInput = h('input', {type: 'datetime-local', id: 'history-to', required: true});
  const customNote = h('p', {class: 'error history-note', role: 'alert'});
  const customForm = h('form', {id: 'history-custom', class: 'toolbar', hidden: true, onsubmit: applyCustom},
    h('div', {class: 'field'}, h('label', {for: 'history-from'}, t('history.from')), fromInput),
    h('div', {class: 'field'}, h('label', {for: 'history-to'}, t('history.to')), toInput),
    h('button', {class: 'primary'}, t('history.apply')), customNote);
  const caption = h('p', {class: 'history-caption', 'aria-live': 'polite'});
  const zoomBar = h('div', {class: 'history-zoom', hidden: true},
    h('button', {type: 'button', onclick: () => unzoom(1)}, t('history.zoom_out')),
    h('button', {type: 'button', onclick: () => unzoom(Infinity)}, t('history.zoom_reset')));
  const controls = h('div', {class: 'history-controls', hidden: true},
    h('div', {class: 'toolbar history-ranges', role: 'group', 'aria-label': t('history.ranges')},
      rangeButtons, customButton),
    customForm,
    h('div', {class: 'history-where'},
      h('div', {}, caption, h('p', {class: 'muted'}, t('history.hint', {custom: t('history.range.custom')}))), zoomBar));
  const notice = h('div', {class: 'notice history-notice', role: 'alert', hidden: true});
  const grid = h('div', {class: 'grid history-charts', hidden: true});
  const loading = h('p', {class: 'muted'}, t('history.loading'));
  container.append(loading, controls, notice, grid);
  markRange();

  // About one point for each pixel of a chart's width.
  const points = () => Math.min(kMaxPoints, Math.max(60, Math.round(container.clientWidth - 100)));
  const following = () => preset !== 'custom' && zooms.length === 0;

  function markRange() {
    for (const button of [...rangeButtons, customButton]) {
      button.setAttribute('aria-pressed', String(button.dataset.range === preset));
    }
  }

  function buildCharts() {
    const known = new Set(info.series.map((one) => one.id));
    for (const def of kCharts) {
      const objects = def.pick ? [...new Set(info.series.filter((one) => one.metric === def.lines[0].metric)
        .map((one) => one.labels?.[def.pick]).filter(Boolean))].sort() : [];
      const select = def.pick ? h('select', {onchange: draw},
        h('option', {value: ''}, t(`history.all.${def.pick}`)),
        objects.map((name) => h('option', {value: name}, name))) : null;
      const card = h('div', {class: 'card', dataset: {chart: def.id}},
        h('div', {class: 'history-head'}, h('h3', {}, t(`history.chart.${def.id}`)),
          select && h('label', {}, t(`history.pick.${def.pick}`), select)));
      // The chart takes its holder's whole width: one without the card's padding.
      const holder = h('div');
      card.append(holder);
      grid.append(card);
      const chart = createChart(holder, {
        unit: def.unit, bands: true, height: 190, yRange: def.yRange ?? null, onSelect: zoom,
        series: def.lines.map((line) => ({label: t(`history.line.${line.label}`)})),
      });
      const ids = def.lines.flatMap((line) => (def.pick ? objects.map((name) => `${line.metric}@${name}`)
        : [line.metric])).filter((id) => known.has(id));
      charts.push({def, objects, select, chart, ids});
    }
  }

  function draw() {
    if (!last) return;
    const {times, series} = last;
    const nulls = new Array(times.length).fill(null);
    const get = (id) => series.get(id) ?? {avg: nulls, min: nulls, max: nulls};
    for (const {def, objects, select, chart} of charts) {
      chart.setData(times, def.lines.flatMap((line) => {
        let one;
        if (!def.pick) one = get(line.metric);
        else if (select.value) one = get(`${line.metric}@${select.value}`);
        else one = sumSeries(objects.map((name) => get(`${line.metric}@${name}`)), times.length);
        if (line.flip) one = complement(one);
        return [one.avg, one.min, one.max];
      }));
      chart.setWindow(last.from, last.to);
    }
  }

  // Adds the real-time samples since the last ones, keeping `reach` seconds.
  async function updateLive(ids, reach) {
    const answer = await realtime(ids, live.now || Math.floor(Date.now() / 1000) - reach);
    const keep = (answer.now || live.now) - reach;
    for (const [id, one] of answer.series) {
      const old = live.series.get(id) ?? {times: [], values: []};
      const after = old.times.at(-1) ?? -Infinity;
      const times = [];
      const values = [];
      old.times.concat(one.times).forEach((time, i) => {
        if (time > keep && (i < old.times.length || time > after)) {
          times.push(time);
          values.push(i < old.times.length ? old.values[i] : one.values[i - old.times.length]);
        }
      });
      live.series.set(id, {times, values});
    }
    live.now = Math.max(live.now, answer.now ?? 0);
  }

  async function load(mine) {
    const ids = charts.flatMap((one) => one.ids);
    // Samples of at most 15 minutes: before that, minute rows show as much.
    const reach = Math.min(info.realtime_minutes ?? 15, 15) * 60;
    const count = points();
    // The samples matter when the window reaches the collector's newest minutes.
    const nearNow = (range) => range.to > (live.now || Date.now() / 1000) - reach;
    if (following() || nearNow(shown)) await updateLive(ids, reach);
    const to = Math.ceil(live.now || Date.now() / 1000);
    const range = following() ? {from: to - kSpans[preset], to} : shown;
    const answer = await history(ids, range.from, range.to, count);
    if (mine !== loads || stopped) return;
    const bucket = Math.max(info.interval ?? 1, Math.ceil((range.to - range.from) / count));
    const samples = nearNow(range) ? live.series : new Map();
    last = {...joinSeries(ids, answer.series, answer.step, samples, bucket, range.from), ...range};
    shown = range;
    showCharts();
    draw();
    caption.textContent = t(last.times.length === 0 ? 'history.empty' : 'history.caption', {
      from: formatTime(range.from), to: formatTime(range.to), step: stepText(answer.step),
    });
    // Focus leaves the zoom buttons before they go.
    if (zooms.length === 0 && zoomBar.contains(document.activeElement)) {
      controls.querySelector('[aria-pressed="true"]')?.focus();
    }
    zoomBar.hidden = zooms.length === 0;
  }

  function showCharts() {
    trouble = '';
    loading.remove();
    notice.hidden = true;
    controls.hidden = false;
    grid.hidden = false;
  }

  function showTrouble(kind, error) {
    const text = kind === 'collector' || kind === 'failed' ? errorText(error) : t(`history.${kind}`);
    loading.remove();
    controls.hidden = true;
    grid.hidden = true;
    notice.hidden = false;
    if (trouble === `${kind}:${text}`) return;  // said already: don't repeat it to screen readers
    trouble = `${kind}:${text}`;
    const settings = kind === 'off' || kind === 'database';
    notice.replaceChildren(
      h('p', {}, h('strong', {}, text)),
      h('p', {}, t(settings ? `history.${kind}_more` : 'history.retry')));
    if (settings) {
      notice.append(h('p', {}, h('a', {href: '#/settings', class: 'button'}, t('history.settings'))));
    }
  }

  async function refresh() {
    const mine = ++loads;
    try {
      info = await catalog({fresh: Boolean(trouble)});
      if (mine !== loads || stopped) return;
      if (!info.history?.enabled) return showTrouble('off');
      if (info.history.state === 'waiting') return showTrouble('database');
      if (charts.length === 0) buildCharts();
      await load(mine);
      if (mine === loads) loaded = Date.now();
    } catch (error) {
      if (mine !== loads || stopped) return;
      console.debug('history failed', error);
      showTrouble(troubleOf(error), error);
    } finally {
      if (mine === loads) grid.removeAttribute('aria-busy');
    }
  }

  // A load for a change the user made, now.
  function reload() {
    loaded = 0;
    grid.setAttribute('aria-busy', 'true');
    refresh();
  }

  // A preset follows now: it is loaded again when a point's worth of time has passed.
  function due() {
    if (trouble || !loaded) return true;
    if (!following()) return false;
    return Date.now() - loaded >= 1000 * Math.min(60, Math.max(10, kSpans[preset] / points()));
  }

  function choose(key) {
    preset = key;
    zooms = [];
    customForm.hidden = true;
    customButton.setAttribute('aria-expanded', 'false');
    markRange();
    reload();
  }

  function toggleCustom() {
    customForm.hidden = !customForm.hidden;
    customButton.setAttribute('aria-expanded', String(!customForm.hidden));
    if (customForm.hidden) return;
    if (shown) {
      fromInput.value = inputOfSeconds(shown.from);
      toInput.value = inputOfSeconds(shown.to);
    }
    fromInput.focus();
  }

  function applyCustom(event) {
    event.preventDefault();
    const from = secondsOfInput(fromInput.value);
    const to = secondsOfInput(toInput.value);
    if (!(from > 0 && to > from)) {
      customNote.textContent = t('history.bad_range');
      return;
    }
    if (to - from < kMinSpan) {
      customNote.textContent = t('history.short_range', {seconds: kMinSpan});
      return;
    }
    customNote.textContent = '';
    preset = 'custom';
    zooms = [];
    shown = {from, to};
    markRange();
    reload();
  }

  function zoom(from, to) {
    if (!shown || trouble) return;
    if (to - from < kMinSpan) {
      from = Math.floor((from + to - kMinSpan) / 2);
      to = from + kMinSpan;
    }
    zooms.push(shown);
    shown = {from, to};
    reload();
  }

  function unzoom(steps) {
    if (zooms.length === 0) return;
    shown = zooms.splice(Math.max(0, zooms.length - steps))[0];
    reload();
  }

  const poller = startPolling(() => (due() ? refresh() : undefined), kTickMs);
  return {
    unmount() {
      stopped = true;
      poller.stop();
      for (const one of charts) one.chart.destroy();
      charts.length = 0;
    },
  };
}
