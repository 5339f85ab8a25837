// The overview: live charts of the collector's series over its real-time
// window, a sample a second, with the performance events of that window drawn
// on every chart. The charts follow the catalog: what the machine has shows up.

import {ApiError} from '../api.js';
import {createChart} from '../chart.js';
import {showCallError} from '../errors.js';
import {define, t} from '../i18n.js';
import {LiveStore} from '../live.js';
import {h, startPolling} from '../ui.js';
import {catalog, collectorNow, events, realtime} from '../usage.js';

define({
  enu: {
    'overview.window': 'The last {minutes} minutes, a sample a second.',
    'overview.cores': 'Show each core',
    'overview.cpu': 'CPU',
    'overview.cpu_cores': 'CPU by core (busy)',
    'overview.core': 'CPU {n}',
    'overview.user': 'User',
    'overview.system': 'System',
    'overview.iowait': 'I/O wait',
    'overview.memory': 'Memory and swap',
    'overview.mem_used': 'Used',
    'overview.mem_cached': 'Cached',
    'overview.mem_available': 'Available',
    'overview.swap_used': 'Swap used',
    'overview.network': 'Network {name}',
    'overview.received': 'Received',
    'overview.sent': 'Sent',
    'overview.no_network': 'No network interface.',
    'overview.disk': 'Disk {name}: throughput',
    'overview.iops': 'Disk {name}: operations',
    'overview.read': 'Read',
    'overview.written': 'Written',
    'overview.util': 'Disk utilisation',
    'overview.disks': 'Disks',
    'overview.no_disk': 'No disk.',
    'overview.volume': 'Volume {name}: space',
    'overview.used': 'Used',
    'overview.size': 'Size',
    'overview.volumes': 'Volumes',
    'overview.no_volume': 'No volume is mounted.',
    'overview.lun': 'iSCSI LUN I/O',
    'overview.lun_latency': 'iSCSI LUN latency',
    'overview.no_lun': 'No iSCSI LUN on this system.',
  },
  ger: {
    'overview.window': 'Die letzten {minutes} Minuten, ein Messwert pro Sekunde.',
    'overview.cores': 'Jeden Kern zeigen',
    'overview.cpu': 'CPU',
    'overview.cpu_cores': 'CPU nach Kern (belegt)',
    'overview.core': 'CPU {n}',
    'overview.user': 'Benutzer',
    'overview.system': 'System',
    'overview.iowait': 'E/A-Wartezeit',
    'overview.memory': 'Arbeitsspeicher und Auslagerung',
    'overview.mem_used': 'Belegt',
    'overview.mem_cached': 'Cache',
    'overview.mem_available': 'Verfügbar',
    'overview.swap_used': 'Auslagerung belegt',
    'overview.network': 'Netzwerk {name}',
    'overview.received': 'Empfangen',
    'overview.sent': 'Gesendet',
    'overview.no_network': 'Keine Netzwerkschnittstelle.',
    'overview.disk': 'Festplatte {name}: Durchsatz',
    'overview.iops': 'Festplatte {name}: Operationen',
    'overview.read': 'Gelesen',
    'overview.written': 'Geschrieben',
    'overview.util': 'Festplattenauslastung',
    'overview.disks': 'Festplatten',
    'overview.no_disk': 'Keine Festplatte.',
    'overview.volume': 'Volume {name}: Speicherplatz',
    'overview.used': 'Belegt',
    'overview.size': 'Größe',
    'overview.volumes': 'Volumes',
    'overview.no_volume': 'Kein Volume ist eingehängt.',
    'overview.lun': 'iSCSI-LUN-E/A',
    'overview.lun_latency': 'iSCSI-LUN-Latenz',
    'overview.no_lun': 'Kein iSCSI-LUN auf diesem System.',
  },
});

const kEventMilliseconds = 5000;
const kChartHeight = 180;
const busy = (idle) => 100 - idle;
// The lowest top of a y axis by unit, so that an idle chart has no axis of fractions.
const kFloor = {'B': [0, 1024], 'B/s': [0, 1024], 'IO/s': [0, 10], 'ms': [0, 10]};

// The objects of `metric` in catalog order: [{name, labels}].
function objectsOf(catalogSeries, metric) {
  return catalogSeries.filter((one) => one.metric === metric)
    .map((one) => ({name: one.id.slice(metric.length + 1), labels: one.labels ?? {}}));
}

// The charts of the catalog's series, in groups: [{key, title, unit, yRange,
// series: [{id, label, transform}]}], or {key, title, empty} for a group the
// machine has nothing of.
function layoutOf(catalogSeries, perCore) {
  const known = new Set(catalogSeries.map((one) => one.id));
  const layout = [];
  const chart = (key, title, unit, series, yRange = null) => {
    const present = series.filter((one) => known.has(one.id));
    if (present.length) layout.push({key, title, unit, yRange, series: present});
    return present.length > 0;
  };
  const group = (key, title, empty, add) => {
    const before = layout.length;
    add();
    if (layout.length === before) layout.push({key, title, empty});
  };
  const line = (id, label, transform) => ({id, label, transform});

  chart('cpu', t('overview.cpu'), '%', [line('cpu.user', t('overview.user')),
    line('cpu.system', t('overview.system')), line('cpu.iowait', t('overview.iowait'))], [0, 100]);
  if (perCore) {
    chart('cores', t('overview.cpu_cores'), '%', objectsOf(catalogSeries, 'cpu.idle').map(({name, labels}) =>
      line(`cpu.idle@${name}`, t('overview.core', {n: labels.cpu ?? name}), busy)), [0, 100]);
  }
  chart('memory', t('overview.memory'), 'B', [line('mem.used', t('overview.mem_used')),
    line('mem.cached', t('overview.mem_cached')), line('mem.available', t('overview.mem_available')),
    line('swap.used', t('overview.swap_used'))]);
  group('network', t('overview.network', {name: ''}).trim(), t('overview.no_network'), () => {
    for (const {name} of objectsOf(catalogSeries, 'net.rx_bytes')) {
      chart(`net@${name}`, t('overview.network', {name}), 'B/s', [
        line(`net.rx_bytes@${name}`, t('overview.received')), line(`net.tx_bytes@${name}`, t('overview.sent'))]);
    }
  });
  const disks = objectsOf(catalogSeries, 'disk.read_bytes');
  group('disk', t('overview.disks'), t('overview.no_disk'), () => {
    for (const {name} of disks) {
      chart(`disk@${name}`, t('overview.disk', {name}), 'B/s', [
        line(`disk.read_bytes@${name}`, t('overview.read')), line(`disk.write_bytes@${name}`, t('overview.written'))]);
      chart(`iops@${name}`, t('overview.iops', {name}), 'IO/s', [
        line(`disk.read_iops@${name}`, t('overview.read')), line(`disk.write_iops@${name}`, t('overview.written'))]);
    }
    chart('util', t('overview.util'), '%',
          objectsOf(catalogSeries, 'disk.util').map(({name}) => line(`disk.util@${name}`, name)), [0, 100]);
  });
  group('volume', t('overview.volumes'), t('overview.no_volume'), () => {
    for (const {name} of objectsOf(catalogSeries, 'volume.used')) {
      chart(`volume@${name}`, t('overview.volume', {name}), 'B', [
        line(`volume.used@${name}`, t('overview.used')), line(`volume.size@${name}`, t('overview.size'))]);
    }
  });
  group('lun', t('overview.lun'), t('overview.no_lun'), () => {
    const luns = objectsOf(catalogSeries, 'lun.io');
    chart('lun', t('overview.lun'), 'B/s', luns.map(({name, labels}) => line(`lun.io@${name}`, labels.name || name)));
    chart('lun_latency', t('overview.lun_latency'), 'ms',
          luns.map(({name, labels}) => line(`lun.latency@${name}`, labels.name || name)));
  });
  return layout;
}

export function mount(container) {
  const store = new LiveStore();
  let charts = [];    // [{card, chart, arrays, visible, version, markers}]
  let planned = '';   // the layout's ids, to see when the catalog changes
  let perCore = false;
  let reach = 0;      // seconds of the real-time window
  let utcOffset = 0;
  let markers = [];
  let version = 0;    // counts changes of the samples held
  let updates = 0;    // updates drawn, for the measures
  let eventsAt = 0;
  let stopped = false;
  let lastCatalog = null;
  let entries = [];   // the catalog's series, and those gone from it whose samples are still held

  const intro = h('p', {class: 'muted overview-window'});
  const notice = h('p', {class: 'notice', role: 'alert', hidden: true});
  const coreBox = h('input', {type: 'checkbox', id: 'overview-cores', onchange: () => {
    perCore = coreBox.checked;
    if (lastCatalog) plan(lastCatalog, true);
  }});
  const coreField = h('label', {class: 'check', for: 'overview-cores', hidden: true}, coreBox, t('overview.cores'));
  const grid = h('div', {class: 'grid live-charts'});
  container.append(h('div', {class: 'toolbar'}, intro, coreField), notice, grid);

  // Only charts on screen are drawn every second; one that comes into view
  // catches up at once.
  const cards = new Map();  // card → chart entry
  const seen = new IntersectionObserver((changes) => {
    for (const change of changes) {
      const one = cards.get(change.target);
      if (!one) continue;
      one.visible = change.isIntersecting;
      if (one.visible) refresh(one);
    }
  });

  function destroyCharts() {
    seen.disconnect();
    cards.clear();
    for (const one of charts) one.chart.destroy();
    charts = [];
  }

  // The catalog's series in a steady order. A series that left it (the
  // collector restarted, or the object went) stays while its samples are held.
  function merge(series) {
    const current = new Map(series.map((one) => [one.id, one]));
    const kept = entries.filter((one) => current.has(one.id) || store.holds(one.id))
      .map((one) => current.get(one.id) ?? one);
    const known = new Set(kept.map((one) => one.id));
    return kept.concat(series.filter((one) => !known.has(one.id)));
  }

  // Lays the charts out again when the catalog's series or the per-core choice changed.
  function plan(answer, force = false) {
    if (answer === lastCatalog && !force) return;
    lastCatalog = answer;
    entries = merge(answer.series ?? []);
    const layout = layoutOf(entries, perCore);
    const drawn = layout.filter((item) => !item.empty);
    const signature = JSON.stringify(drawn.map((item) => [item.key, item.series.map((one) => one.id)]));
    coreField.hidden = !entries.some((one) => one.metric === 'cpu.idle' && one.labels?.cpu);
    intro.textContent = t('overview.window', {minutes: answer.realtime_minutes});
    if (signature === planned) return;
    planned = signature;
    store.keep(drawn.flatMap((item) => item.series));
    destroyCharts();
    grid.replaceChildren();
    layout.forEach((item, index) => {
      const heading = h('h3', {id: `overview-chart-${index}`}, item.title);
      if (item.empty) {
        grid.append(h('section', {class: 'card chart-card empty', 'aria-labelledby': heading.id,
                                  dataset: {chart: item.key}}, heading, h('p', {class: 'muted'}, item.empty)));
        return;
      }
      const box = h('div', {class: 'chart-box'});
      const card = h('section', {class: 'card chart-card', 'aria-labelledby': heading.id,
                                 dataset: {chart: item.key, points: '0', markers: '0'}}, heading, box);
      grid.append(card);
      const chart = createChart(box, {unit: item.unit, height: kChartHeight, live: true,
                                      yRange: item.yRange ?? kFloor[item.unit] ?? null,
                                      series: item.series.map(({label}) => ({label}))});
      const one = {card, chart, arrays: item.series.map(({id}) => store.values(id)),
                   visible: false, version: -1, markers: null};
      charts.push(one);
      cards.set(card, one);
      seen.observe(card);
    });
    for (const one of charts) refresh(one);
  }

  // Brings a chart up to the samples and markers held.
  function refresh(one) {
    if (one.version !== version) {
      one.version = version;
      one.chart.setData(store.times, one.arrays);
      one.card.dataset.points = String(store.times.length);
    }
    if (one.markers !== markers) {
      one.markers = markers;
      one.chart.setMarkers(markers);
      one.card.dataset.markers = String(markers.length);
    }
  }

  function draw() {
    for (const one of charts) if (one.visible) refresh(one);
  }

  async function loadEvents(now) {
    eventsAt = Date.now();
    let list;
    try {
      list = await events(now - reach, now, utcOffset);
    } catch (error) {
      if (!(error instanceof ApiError)) throw error;
      return;  // the markers stay as they were; the next round tries again
    }
    if (stopped) return;
    markers = list;
    draw();
  }

  // Each update's script time, as the user-timing measure "overview-update";
  // an hour's worth is kept.
  function measureUpdate(started) {
    updates += 1;
    if (updates % 3600 === 0) performance.clearMeasures('overview-update');
    performance.measure('overview-update', {start: started});
    container.dataset.updates = String(updates);
    container.dataset.series = String(store.ids.length);
  }

  async function tick() {
    try {
      const answer = await catalog();
      if (stopped) return;
      reach = answer.realtime_minutes * 60;
      utcOffset = answer.utc_offset ?? 0;
      plan(answer);
      const pending = store.pending;
      if (pending.length) {
        const past = await realtime(pending, store.oldest - 1);
        if (stopped) return;
        store.fill(past.series);
        version += 1;
      }
      const since = store.newest || collectorNow() - reach;
      const fresh = await realtime(store.ids, since);
      if (stopped) return;
      const started = performance.now();
      if (store.append(fresh.series)) version += 1;
      if (fresh.now && store.trim(fresh.now - reach + 1)) version += 1;
      draw();
      await null;  // uPlot paints in a microtask queued by setData
      measureUpdate(started);
      notice.hidden = true;
      if (Date.now() - eventsAt >= kEventMilliseconds) await loadEvents(fresh.now || store.newest);
    } catch (error) {
      if (!stopped) showCallError(notice, error);
    }
  }

  const polling = startPolling(tick, 1000);
  return {
    unmount() {
      stopped = true;
      polling.stop();
      destroyCharts();
    },
  };
}
