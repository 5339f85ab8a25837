// The services screen: the services and packages that use the most CPU or
// memory now, by the newest sample of each, updated every second.

import {showCallError} from '../errors.js';
import {formatValue} from '../format.js';
import {define, locale, t} from '../i18n.js';
import {h, startPolling} from '../ui.js';
import {catalog, collectorNow, realtime} from '../usage.js';

define({
  enu: {
    'services.caption': 'Services and packages by their use now',
    'services.name': 'Service',
    'services.cpu': 'CPU',
    'services.memory': 'Memory',
    'services.sort_by': 'Sort by {column}',
    'services.all': 'Show all {count}',
    'services.top': 'Show the top {count}',
    'services.none': 'No service is running.',
  },
  ger: {
    'services.caption': 'Dienste und Pakete nach ihrer aktuellen Nutzung',
    'services.name': 'Dienst',
    'services.cpu': 'CPU',
    'services.memory': 'Arbeitsspeicher',
    'services.sort_by': 'Nach {column} sortieren',
    'services.all': 'Alle {count} zeigen',
    'services.top': 'Die ersten {count} zeigen',
    'services.none': 'Kein Dienst läuft.',
  },
});

const kTop = 10;
// A service whose newest sample is this much older than the newest of all has
// stopped; the collector keeps its series while the window holds its samples.
const kStoppedSeconds = 3;
const kNames = new Intl.Collator(locale, {numeric: true});
const kMetrics = {'service.cpu': 'cpu', 'service.memory': 'memory'};

// Services in the order of `key` ("cpu" or "memory"), highest first, then by name.
function ranked(services, key) {
  return services.sort((a, b) => ((b[key] ?? -1) - (a[key] ?? -1)) ||
                                      kNames.compare(a.display, b.display));
}

export function mount(container) {
  const services = new Map();  // name → {name, display, cpu, memory, time}
  const columns = new Map();   // series id → [service name, "cpu" or "memory"]
  let loaded = false;
  let sortKey = 'cpu';
  let showAll = false;
  let since = 0;
  let stopped = false;

  const notice = h('p', {class: 'notice', role: 'alert', hidden: true});
  const sortButton = (key) => h('button', {type: 'button', class: 'sort', dataset: {key},
                                           title: t('services.sort_by', {column: t(`services.${key}`)}),
                                           onclick: () => sortBy(key)}, t(`services.${key}`));
  const headers = {
    cpu: h('th', {scope: 'col', class: 'number'}, sortButton('cpu')),
    memory: h('th', {scope: 'col', class: 'number'}, sortButton('memory')),
  };
  const body = h('tbody');
  const empty = h('p', {class: 'muted', hidden: true}, t('services.none'));
  const more = h('button', {type: 'button', class: 'plain', hidden: true, onclick: () => {
    showAll = !showAll;
    render();
  }});
  const table = h('table', {class: 'services-table'},
    h('caption', {class: 'muted'}, t('services.caption')),
    h('thead', {}, h('tr', {}, h('th', {scope: 'col'}, t('services.name')), headers.cpu, headers.memory)),
    body);
  container.append(notice, h('div', {class: 'table-wrap'}, table), empty, more);

  function sortBy(key) {
    sortKey = key;
    render();
  }

  function render() {
    for (const [key, header] of Object.entries(headers)) {
      if (key === sortKey) header.setAttribute('aria-sort', 'descending');
      else header.removeAttribute('aria-sort');
    }
    const list = ranked([...services.values()].filter((one) => one.time >= since - kStoppedSeconds), sortKey);
    const shown = showAll ? list : list.slice(0, kTop);
    body.replaceChildren(...shown.map((one) => h('tr', {dataset: {service: one.name}},
      h('td', {}, one.display, one.display !== one.name ? h('span', {class: 'muted service-id'}, one.name) : null),
      h('td', {class: 'number'}, formatValue(one.cpu, '%')),
      h('td', {class: 'number'}, formatValue(one.memory, 'B')))));
    empty.hidden = !loaded || list.length > 0;
    more.hidden = list.length <= kTop;
    more.textContent = showAll ? t('services.top', {count: kTop}) : t('services.all', {count: list.length});
  }

  // Takes the services of the catalog, keeping the values held of those still
  // there; answers their series' ids.
  function know(series) {
    const names = new Set();
    columns.clear();
    for (const one of series) {
      const key = kMetrics[one.metric];
      if (!key) continue;
      const name = one.labels?.service ?? one.id.slice(one.metric.length + 1);
      const display = one.labels?.display_name || name;
      names.add(name);
      columns.set(one.id, [name, key]);
      const known = services.get(name);
      if (known) known.display = display;
      else services.set(name, {name, display, cpu: null, memory: null, time: 0});
    }
    for (const name of services.keys()) if (!names.has(name)) services.delete(name);
    return [...columns.keys()];
  }

  async function tick() {
    try {
      const ids = know((await catalog()).series ?? []);
      if (stopped) return;
      if (ids.length) {
        const answer = await realtime(ids, since || collectorNow() - 60);
        if (stopped) return;
        for (const [id, one] of answer.series) {
          const [name, key] = columns.get(id) ?? [];
          const service = services.get(name);
          if (!service || one.times.length === 0) continue;
          service[key] = one.values[one.values.length - 1];
          service.time = Math.max(service.time, one.times[one.times.length - 1]);
          since = Math.max(since, service.time);
        }
      }
      loaded = true;
      notice.hidden = true;
      render();
    } catch (error) {
      if (!stopped) showCallError(notice, error);
    }
  }

  render();
  const polling = startPolling(tick, 1000);
  return {
    unmount() {
      stopped = true;
      polling.stop();
    },
  };
}
