// The overview against the real collector and event daemon: charts that open
// with the window held and gain a point a second, the per-core chart, phone
// width, a collector that stops and comes back, and a CPU event of the daemon
// drawn on the charts with its text on hover. The store under the charts is
// checked on its own first.

import assert from 'node:assert/strict';
import {spawn} from 'node:child_process';
import {test} from 'node:test';
import {LiveStore} from '../www/js/live.js';
import {apiSession, openPage, screenshot, signIn, useSystem, waitFor} from './system.mjs';

let system;
let browser;
useSystem({}, (started) => ({system, browser} = started));

const points = async (page, key) => Number(await page.locator(`[data-chart="${key}"]`).getAttribute('data-points'));

test('the store lines series up on one time axis, trims in place and fills series added later', () => {
  const store = new LiveStore();
  store.keep([{id: 'a'}, {id: 'idle', transform: (value) => 100 - value}]);
  assert.equal(store.append(new Map([['a', {times: [10, 11, 12], values: [1, 2, 3]}],
                                     ['idle', {times: [11, 12], values: [40, 30]}]])), 3);
  assert.deepEqual(store.times, [10, 11, 12]);
  assert.deepEqual(store.values('idle'), [null, 60, 70]);
  const held = store.values('a');
  // A time already held is not added twice; a series left out of an answer gets a gap.
  assert.equal(store.append(new Map([['a', {times: [12, 14], values: [3, 5]}]])), 1);
  assert.deepEqual(store.values('idle'), [null, 60, 70, null]);
  assert.equal(store.trim(12), 2);
  assert.deepEqual(store.times, [12, 14]);
  assert.equal(store.values('a'), held);
  assert.deepEqual(held, [3, 5]);

  store.keep([{id: 'a'}, {id: 'b'}]);
  assert.equal(store.values('idle'), undefined);
  assert.deepEqual(store.pending, ['b']);
  store.fill(new Map([['b', {times: [11, 12, 13, 14], values: [7, 8, 9, 10]}]]));
  assert.deepEqual(store.values('b'), [8, 10]);
  assert.deepEqual(store.pending, []);
  // Series whose seconds differ are merged in order.
  store.append(new Map([['a', {times: [15, 17], values: [1, 1]}], ['b', {times: [16, 17], values: [2, 2]}]]));
  assert.deepEqual(store.times, [12, 14, 15, 16, 17]);
  assert.deepEqual(store.values('b'), [8, 10, null, 2, 2]);
});

test('charts open with the window held, gain points, show each core, fit a phone and outlive the collector', async () => {
  const call = await apiSession(system);
  // Rates join the catalog from the collector's second pass on.
  const {series} = await waitFor(async () => {
    const answer = await call('KOVA.ResourceMonitor.Usage', 'catalog');
    return answer.series.some((one) => one.id === 'cpu.idle@cpu0') && answer;
  }, 'the catalog to list the rates');
  const {context, page, problems} = await openPage(browser, system.url);
  await signIn(page);
  for (const {labels} of series.filter((one) => one.metric === 'net.rx_bytes')) {
    await page.getByRole('heading', {name: `Network ${labels.interface}`}).waitFor();
  }
  await page.getByText('No iSCSI LUN on this system.').waitFor();
  await page.getByRole('heading', {name: 'Memory and swap'}).waitFor();

  const first = await waitFor(() => points(page, 'cpu'), 'points on the CPU chart');
  await waitFor(async () => (await points(page, 'cpu')) >= first + 2, 'the CPU chart to gain points');
  // Shown again, the screen asks for the whole window at once.
  const held = await points(page, 'cpu');
  await page.getByRole('link', {name: 'Services'}).click();
  await page.getByRole('link', {name: 'Overview'}).click();
  assert.ok(await waitFor(() => points(page, 'cpu'), 'the CPU chart again') >= held);

  await page.getByLabel('Show each core').focus();
  await page.keyboard.press('Space');
  // Each core's busy share, and the samples from before the chart was asked for.
  const legend = page.locator('[data-chart="cores"] .u-legend');
  await waitFor(async () => /CPU 0\s*\d.*CPU 1\s*\d/.test(await legend.textContent()), 'values of each core');
  const plot = await page.locator('[data-chart="cores"] .u-over').boundingBox();
  await page.mouse.move(plot.x + plot.width / 4, plot.y + plot.height / 2);
  assert.match(await legend.textContent(), /CPU 0\s*\d/);
  await page.mouse.move(0, 0);
  await screenshot(page, 'overview');

  await page.setViewportSize({width: 390, height: 844});
  await waitFor(() => page.evaluate(() => {
    const canvas = document.querySelector('[data-chart="cpu"] canvas');
    return document.documentElement.scrollWidth <= 390 && canvas.getBoundingClientRect().right <= 390;
  }), 'the charts to fit the phone width');
  await screenshot(page, 'overview-phone');

  system.kova(['service', 'stop', 'kovastatd']);
  const notice = page.getByText('The statistics collector is not running or does not answer.');
  await notice.waitFor();
  system.kova(['service', 'start', 'kovastatd']);
  await notice.waitFor({state: 'hidden'});
  const after = await points(page, 'cpu');
  await waitFor(async () => (await points(page, 'cpu')) > after, 'points after the collector came back');
  assert.deepEqual(problems, []);
  await context.close();
});

test('a CPU event of the event daemon is drawn on every chart with its text, and logged', async () => {
  const call = await apiSession(system);
  await call('KOVA.ResourceMonitor.EventRule', 'set',
             {type: 0, service: '', resource: 1, severity: 1, threshold: 1, enable: true});
  await call('KOVA.ResourceMonitor.Setting', 'set', {enable_event: true});
  const burner = spawn('sh', ['-c', 'while :; do :; done'], {stdio: 'ignore'});
  try {
    const {context, page, problems} = await openPage(browser, system.url);
    await signIn(page);
    const card = page.locator('[data-chart="cpu"]');
    await waitFor(async () => Number(await card.getAttribute('data-markers')) > 0, 'a marker on the CPU chart', 30000);
    // A chart out of view gets them when scrolled to.
    const count = await card.getAttribute('data-markers');
    const last = page.locator('[data-markers]').last();
    await last.scrollIntoViewIfNeeded();
    await waitFor(async () => (await last.getAttribute('data-markers')) === count, 'the markers on the last chart');

    // The event is recent: its marker is near the right edge.
    await card.scrollIntoViewIfNeeded();
    const plot = await card.locator('.u-over').boundingBox();
    const tooltip = card.locator('.chart-tooltip');
    for (let x = plot.width - 1; x >= 0 && !(await tooltip.isVisible()); x -= 3) {
      await page.mouse.move(plot.x + x, plot.y + plot.height / 2);
    }
    assert.match(await tooltip.textContent(), /CPU use of the system has been above 1% for 30 seconds/);
    await screenshot(page, 'overview-event');

    const {logs} = await call('KOVA.ResourceMonitor.Log', 'list', {offset: 0, limit: 20});
    assert.ok(logs.some((entry) => entry.level === 'Warning' &&
                                   entry.event.startsWith('CPU use of the system has been above 1%')),
              JSON.stringify(logs));
    assert.deepEqual(problems, []);
    await context.close();
  } finally {
    burner.kill();
  }
});
