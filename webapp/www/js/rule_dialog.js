// The dialog that creates or changes a performance-event rule, with a live
// preview of what the rule watches: the object's resource over the last ten
// minutes, measured as kovaperfeventd measures it, and the threshold on it.

import {call} from './api.js';
import {createChart} from './chart.js';
import {errorText} from './errors.js';
import {define, locale, t} from './i18n.js';
import {h, startPolling} from './ui.js';
import {catalog, realtime} from './usage.js';

define({
  enu: {
    'rule.system': 'Whole system',
    'rule.services': 'Services and packages',
    'rule.luns': 'iSCSI LUNs',
    'rule.resource.1': 'CPU',
    'rule.resource.2': 'Memory',
    'rule.resource.3': 'I/O rate',
    'rule.resource.4': 'I/O latency',
    'rule.severity.1': 'Warning',
    'rule.severity.2': 'Critical',
    'rule.new': 'New rule',
    'rule.edit': 'Edit rule',
    'rule.object': 'Object',
    'rule.resource': 'Resource',
    'rule.severity': 'Severity',
    'rule.threshold': 'Threshold',
    'rule.enabled': 'Enabled',
    'rule.save': 'Save',
    'rule.preview': 'Preview: the last 10 minutes',
    'rule.no_data': 'No data in the last 10 minutes.',
    'rule.bad_threshold': 'Enter a whole number from 0 to {max}.',
  },
  ger: {
    'rule.system': 'Gesamtes System',
    'rule.services': 'Dienste und Pakete',
    'rule.luns': 'iSCSI-LUNs',
    'rule.resource.1': 'CPU',
    'rule.resource.2': 'Arbeitsspeicher',
    'rule.resource.3': 'E/A-Rate',
    'rule.resource.4': 'E/A-Latenz',
    'rule.severity.1': 'Warnung',
    'rule.severity.2': 'Kritisch',
    'rule.new': 'Neue Regel',
    'rule.edit': 'Regel bearbeiten',
    'rule.object': 'Objekt',
    'rule.resource': 'Ressource',
    'rule.severity': 'Schweregrad',
    'rule.threshold': 'Schwellenwert',
    'rule.enabled': 'Aktiviert',
    'rule.save': 'Speichern',
    'rule.preview': 'Vorschau: die letzten 10 Minuten',
    'rule.no_data': 'Keine Daten in den letzten 10 Minuten.',
    'rule.bad_threshold': 'Geben Sie eine ganze Zahl von 0 bis {max} ein.',
  },
});

export const kRuleApi = 'KOVA.ResourceMonitor.EventRule';
const kPreviewSeconds = 600;
const kPreviewInterval = 2000;
const kMaxThreshold = 2147483647;  // thresholds are stored as 32-bit integers

// The threshold's unit of each resource, and the resources each object type can watch.
const kUnits = {1: '%', 2: '%', 3: 'KiB/s', 4: 'ms'};
const kFitting = {0: [1, 2, 3, 4], 1: [1, 2], 2: [3, 4]};

export function ruleObject(rule) {
  return rule.name || (rule.type === 0 ? t('rule.system') : rule.service);
}

export function ruleThreshold(rule) {
  return `${rule.threshold.toLocaleString(locale)} ${kUnits[rule.resource] ?? ''}`.trim();
}

// "Web server, CPU, Warning": names a rule in the labels of its controls.
export function ruleLabel(rule) {
  const {resource, severity} = rule;
  return [ruleObject(rule), t(`rule.resource.${resource}`), t(`rule.severity.${severity}`)].join(', ');
}

const percentOf = (part, whole) => (100 * part) / whole;
const total = (values) => (values.length ? values.reduce((sum, value) => sum + value, 0) : NaN);

// The series the rule's measure comes from, and `value(at)`, the measure of one
// second, where `at(id)` is that second's sample of a series (undefined when
// there is none). `series` is the catalog's.
function measureOf(type, object, resource, series) {
  if (type === 1) {
    const used = `service.${resource === 1 ? 'cpu' : 'memory'}@${object}`;
    return resource === 1
      ? {ids: [used], value: (at) => at(used)}
      : {ids: [used, 'mem.total'], value: (at) => percentOf(at(used), at('mem.total'))};
  }
  if (type === 2) {
    const id = `lun.${resource === 3 ? 'io' : 'latency'}@${object}`;
    return {ids: [id], value: (at) => (resource === 3 ? at(id) / 1024 : at(id))};
  }
  const devices = series.filter((one) => one.metric === 'disk.read_bytes').map((one) => one.labels.device);
  const present = (at, ids) => ids.map(at).filter((value) => value !== undefined);
  switch (resource) {
    case 1:
      // Busy as the event daemon counts it: neither idle nor waiting for I/O.
      return {ids: ['cpu.idle', 'cpu.iowait'], value: (at) => 100 - at('cpu.idle') - at('cpu.iowait')};
    case 2:
      return {ids: ['mem.used', 'mem.total'], value: (at) => percentOf(at('mem.used'), at('mem.total'))};
    case 3: {
      const ids = devices.flatMap((device) => [`disk.read_bytes@${device}`, `disk.write_bytes@${device}`]);
      return {ids, value: (at) => total(present(at, ids)) / 1024};
    }
    default: {
      // The time of all I/Os over their number: each disk's mean weighted by its I/Os.
      return {
        ids: devices.flatMap((device) =>
          [`disk.await@${device}`, `disk.read_iops@${device}`, `disk.write_iops@${device}`]),
        value(at) {
          let ios = NaN;
          let time = 0;
          for (const device of devices) {
            const done = present(at, [`disk.read_iops@${device}`, `disk.write_iops@${device}`]);
            if (done.length === 0) continue;
            const count = total(done);
            ios = (ios || 0) + count;
            time += count * (at(`disk.await@${device}`) ?? 0);
          }
          if (Number.isNaN(ios)) return NaN;
          return ios > 0 ? time / ios : 0;
        },
      };
    }
  }
}

// The entries of the object list: whole system, then services and LUNs by display name.
function objectChoices(series, rule) {
  const system = rule?.type === 0 ? rule : {type: 0, service: ''};
  const choices = [{type: 0, object: system.service, name: ruleObject(system)}];
  series.filter((one) => one.metric === 'service.cpu' || one.metric === 'lun.io')
    .map((one) => (one.metric === 'service.cpu'
      ? {type: 1, object: one.labels.service, name: one.labels.display_name || one.labels.service}
      : {type: 2, object: one.labels.lun, name: one.labels.name || one.labels.lun}))
    .sort((a, b) => a.name.localeCompare(b.name, locale))
    .forEach((choice) => choices.push(choice));
  // A rule's object that isn't measured now (a stopped service) stays choosable.
  if (rule && !choices.some((choice) => choice.type === rule.type && choice.object === rule.service)) {
    choices.push({type: rule.type, object: rule.service, name: ruleObject(rule)});
  }
  return choices;
}

// Opens the dialog for `rule` (an answer of "get"), or for a new rule when null.
// Resolves to {closed, close()}: `closed` resolves to true once the rule is saved.
export async function openRuleDialog(rule) {
  let series = [];
  let catalogError = null;
  try {
    series = (await catalog()).series;
  } catch (error) {
    catalogError = error;
  }
  const choices = objectChoices(series, rule);
  const start = rule ?? {type: 0, service: '', resource: 1, severity: 1, threshold: 80, enable: true};
  const option = (choice) => h('option', {value: choices.indexOf(choice)}, choice.name);
  const group = (type, label) => {
    const members = choices.filter((choice) => choice.type === type);
    return members.length ? h('optgroup', {label}, members.map(option)) : null;
  };
  const object = h('select', {id: 'rule-object'}, option(choices[0]), group(1, t('rule.services')),
                   group(2, t('rule.luns')));
  object.value = String(Math.max(0, choices.findIndex((choice) =>
    choice.type === start.type && choice.object === start.service)));
  const resource = h('select', {id: 'rule-resource'});
  const severity = h('select', {id: 'rule-severity'}, [1, 2].map((value) =>
    h('option', {value, selected: value === start.severity}, t(`rule.severity.${value}`))));
  const threshold = h('input', {id: 'rule-threshold', type: 'number', min: '0', step: '1',
                                inputmode: 'numeric', value: String(start.threshold), 'aria-describedby': 'rule-unit'});
  const unit = h('span', {id: 'rule-unit'});
  const enable = h('input', {id: 'rule-enable', type: 'checkbox', checked: start.enable});
  const note = h('p', {class: 'error rule-note', role: 'alert'});
  const plot = h('div', {class: 'rule-chart', dataset: {points: '0'}});
  const empty = h('p', {class: 'muted rule-empty'});
  const save = h('button', {class: 'primary'}, t('rule.save'));
  const field = (label, control, suffix = null) => h('div', {class: 'field'},
    h('label', {for: control.id}, label), suffix ? h('span', {class: 'rule-with-unit'}, control, suffix) : control);
  const dialog = h('dialog', {class: 'rule-dialog', 'aria-labelledby': 'rule-heading'},
    h('form', {class: 'rule-form', novalidate: true, onsubmit: submit},
      h('h3', {id: 'rule-heading'}, t(rule ? 'rule.edit' : 'rule.new')),
      h('div', {class: 'rule-fields'},
        field(t('rule.object'), object), field(t('rule.resource'), resource),
        field(t('rule.severity'), severity), field(t('rule.threshold'), threshold, unit),
        h('div', {class: 'field rule-enable'}, h('label', {}, enable, ` ${t('rule.enabled')}`))),
      h('section', {class: 'rule-preview', 'aria-labelledby': 'rule-preview-heading'},
        h('h4', {id: 'rule-preview-heading'}, t('rule.preview')), plot, empty),
      note,
      h('div', {class: 'buttons'},
        h('button', {type: 'button', class: 'plain', onclick: () => dialog.close()}, t('ui.cancel')), save)));

  const chosen = () => choices[Number(object.value)];
  const percent = () => kUnits[resource.value] === '%';
  // The threshold typed, or null when it is no whole number in range.
  function typedThreshold() {
    const text = threshold.value.trim();
    const value = Number(text);
    return /^\d+$/.test(text) && value <= (percent() ? 100 : kMaxThreshold) ? value : null;
  }

  let chart = null;
  let preview = null;  // {ids, value, since, times, values}: the data of the chart shown
  let polling = null;

  function showThreshold() {
    const value = typedThreshold();
    plot.dataset.threshold = value ?? '';
    chart.setThreshold(value);
    if (value !== null && threshold.hasAttribute('aria-invalid')) {
      threshold.removeAttribute('aria-invalid');
      note.textContent = '';
    }
  }

  async function tick() {
    const mine = preview;
    if (mine.ids.length === 0) {  // the collector has measured no disk yet
      if (!catalogError) empty.textContent = t('rule.no_data');
      return;
    }
    let answer;
    try {
      answer = await realtime(mine.ids, mine.since);
    } catch (error) {
      if (mine === preview) empty.textContent = errorText(error);
      return;
    }
    if (mine !== preview) return;
    const samples = new Map();
    const times = new Set();
    for (const [id, one] of answer.series) {
      samples.set(id, new Map(one.times.map((time, i) => [time, one.values[i]])));
      for (const time of one.times) times.add(time);
    }
    for (const time of [...times].sort((a, b) => a - b)) {
      if (time <= mine.since) continue;
      const value = mine.value((id) => samples.get(id)?.get(time));
      mine.times.push(time);
      mine.values.push(Number.isFinite(value) ? Math.max(0, value) : null);
    }
    mine.since = Math.max(mine.since, answer.now, mine.times.at(-1) ?? 0);
    const kept = mine.times.findIndex((time) => time > mine.since - kPreviewSeconds);
    mine.times.splice(0, kept < 0 ? mine.times.length : kept);
    mine.values.splice(0, mine.values.length - mine.times.length);
    chart.setData(mine.times, [mine.values]);
    if (mine.since > 0) chart.setWindow(mine.since - kPreviewSeconds, mine.since);
    const points = mine.values.filter((value) => value !== null);
    plot.dataset.points = String(points.length);
    plot.dataset.last = points.length ? String(points.at(-1)) : '';
    empty.textContent = points.length ? '' : t('rule.no_data');
  }

  // Shows the chosen object's resource from scratch.
  function restartPreview() {
    polling?.stop();
    chart?.destroy();
    const {type, object: name} = chosen();
    const watched = Number(resource.value);
    unit.textContent = kUnits[watched];
    threshold.max = percent() ? '100' : String(kMaxThreshold);
    chart = createChart(plot, {unit: kUnits[watched], height: 180,
                               series: [{label: `${chosen().name} · ${t(`rule.resource.${watched}`)}`}]});
    showThreshold();
    preview = {...measureOf(type, name, watched, series), since: 0, times: [], values: []};
    plot.dataset.points = '0';
    empty.textContent = catalogError ? errorText(catalogError) : '';
    polling = startPolling(tick, kPreviewInterval);
  }

  function fillResources() {
    const fitting = kFitting[chosen().type];
    const wanted = Number(resource.value || start.resource);
    resource.replaceChildren(...fitting.map((value) => h('option', {value}, t(`rule.resource.${value}`))));
    resource.value = String(fitting.includes(wanted) ? wanted : fitting[0]);
  }

  let saved = false;
  async function submit(event) {
    event.preventDefault();
    const value = typedThreshold();
    if (value === null) {
      threshold.setAttribute('aria-invalid', 'true');
      const max = percent() ? 100 : kMaxThreshold;
      note.textContent = t('rule.bad_threshold', {max: max.toLocaleString(locale)});
      threshold.focus();
      return;
    }
    save.disabled = true;
    note.textContent = '';
    try {
      // A change writes every field, so all of them go.
      await call(kRuleApi, 'set', {
        id: rule?.id, enable: enable.checked, service: chosen().object, type: chosen().type,
        severity: Number(severity.value), resource: Number(resource.value), threshold: value,
      });
      saved = true;
      dialog.close();
    } catch (error) {
      note.textContent = errorText(error);
    } finally {
      save.disabled = false;
    }
  }

  object.addEventListener('change', () => {
    fillResources();
    restartPreview();
  });
  resource.addEventListener('change', restartPreview);
  threshold.addEventListener('input', showThreshold);

  const closed = new Promise((resolve) => dialog.addEventListener('close', () => {
    polling?.stop();
    chart?.destroy();
    preview = null;
    dialog.remove();
    resolve(saved);
  }));
  document.body.append(dialog);
  dialog.showModal();
  fillResources();
  restartPreview();
  object.focus();
  return {closed, close: () => dialog.close()};
}
