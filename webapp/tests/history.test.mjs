// The history screen: how it joins the database's points with the newest
// real-time samples, and what it says when history is off, its database away
// or the collector stopped.

import assert from 'node:assert/strict';
import {after, describe, test} from 'node:test';
import {complement, joinSeries, sumSeries} from '../www/js/history-data.js';
import {launchBrowser, openPage, screenshot, signIn, startSystem, waitFor} from './system.mjs';

// A time as formatTime writes it in en-GB ("24/11/2026, 13:07:09"), in seconds.
function seconds(text) {
  const [day, month, year, hour, minute, second] = text.match(/\d+/g).map(Number);
  return Date.UTC(year, month - 1, day, hour, minute, second) / 1000;
}

// Samples of one a second from `from` to `to` (exclusive), each worth its time.
function samples(from, to) {
  const times = Array.from({length: to - from}, (unused, i) => from + i);
  return {times, values: times.slice()};
}

describe('joining history with real-time samples', () => {
  test('samples follow each series\' last point in buckets of the step, with no gap or overlap', () => {
    const history = new Map([
      ['a', {times: [0, 60, 120], avg: [1, 2, 3], min: [0, 1, 2], max: [2, 3, 4]}],
      ['b', {times: [0, 60], avg: [5, 6], min: [5, 6], max: [5, 6]}],
    ]);
    const live = new Map([['a', samples(150, 250)], ['b', samples(150, 250)]]);
    const {times, series} = joinSeries(['a', 'b'], history, 60, live, 60, 0);
    assert.deepEqual(times, [0, 60, 120, 180, 240]);
    // 150..179 lie in a's point at 120 and are left out; b has no point there.
    assert.deepEqual(series.get('a'), {avg: [1, 2, 3, 209.5, 244.5], min: [0, 1, 2, 180, 240], max: [2, 3, 4, 239, 249]});
    assert.deepEqual(series.get('b'), {avg: [5, 6, 164.5, 209.5, 244.5], min: [5, 6, 150, 180, 240], max: [5, 6, 179, 239, 249]});
  });

  test('finer samples take over from their first bucket, and samples before the window are left out', () => {
    const history = new Map([['a', {times: [60, 120, 180], avg: [1, 2, 3], min: [1, 2, 3], max: [1, 2, 3]}]]);
    const {times, series} = joinSeries(['a'], history, 60, new Map([['a', samples(100, 215)]]), 10, 145);
    assert.deepEqual(times, [60, 150, 160, 170, 180, 190, 200, 210]);
    assert.deepEqual(series.get('a').avg, [1, 154.5, 164.5, 174.5, 184.5, 194.5, 204.5, 212]);
  });

  test('a hole of over two steps breaks the line, and a series without points is all null', () => {
    const history = new Map([['a', {times: [0, 60, 300], avg: [1, 2, 3], min: [1, 2, 3], max: [1, 2, 3]}]]);
    const {times, series} = joinSeries(['a', 'gone'], history, 60, new Map(), 60, 0);
    assert.deepEqual(times, [0, 60, 120, 300]);
    assert.deepEqual(series.get('a').avg, [1, 2, null, 3]);
    assert.deepEqual(series.get('gone').max, [null, null, null, null]);
  });

  test('sums skip missing points, and busy from idle swaps minimum and maximum', () => {
    const sum = sumSeries([{avg: [1, null, null], min: [0, 2, null], max: [2, 3, null]},
                           {avg: [4, 5, null], min: [3, null, null], max: [5, 6, null]}], 3);
    assert.deepEqual(sum, {avg: [5, 5, null], min: [3, 2, null], max: [7, 9, null]});
    assert.deepEqual(complement({avg: [90, null], min: [80, null], max: [95, null]}),
                     {avg: [10, null], min: [5, null], max: [20, null]});
  });
});

describe('history screen', () => {
  let browser;
  const systems = [];
  async function system(settings, options = {}) {
    const one = await startSystem({settings, ...options});
    systems.push(one);
    browser ??= await launchBrowser();
    return one;
  }
  after(async () => {
    await browser?.close();
    for (const one of systems) await one.stop();
  });

  test('with history off it says so and its link leads to the settings', async () => {
    const {url} = await system({});
    const {context, page, problems} = await openPage(browser, url);
    await signIn(page);
    await page.goto(`${url}#/history`);
    await page.getByText('Usage history is switched off.').waitFor();
    assert.equal(await page.getByRole('group', {name: 'Time range'}).isVisible(), false);
    await screenshot(page, 'history-off');
    await page.getByRole('link', {name: 'Open the settings'}).focus();
    await page.keyboard.press('Enter');
    await page.getByRole('heading', {name: 'Settings'}).waitFor();
    assert.equal(new URL(page.url()).hash, '#/settings');
    assert.deepEqual(problems, []);
    await context.close();
  });

  test('history on without a database says so at phone width, then that the collector stopped', async () => {
    const {url, kova} = await system({resourcemonitor_history: 'yes'});
    const {context, page, problems} = await openPage(browser, `${url}#/history`,
                                                     {locale: 'de-DE', viewport: {width: 390, height: 844}});
    await page.getByLabel('Konto').fill('admin');
    await page.getByLabel('Passwort').fill('browser test password');
    await page.getByRole('button', {name: 'Anmelden'}).click();
    await page.getByText('Die Verlaufsdatenbank ist nicht erreichbar.').waitFor();
    assert.equal(await page.getByRole('link', {name: 'Einstellungen öffnen'}).getAttribute('href'), '#/settings');
    assert.ok(await page.evaluate(() => document.documentElement.scrollWidth <= 390), 'no sideways scrolling');
    await screenshot(page, 'history-no-database-phone');

    kova(['service', 'stop', 'kovastatd']);
    await page.getByText('Der Statistikdienst läuft nicht oder antwortet nicht.').waitFor({timeout: 15000});
    assert.equal(await page.getByRole('link', {name: 'Einstellungen öffnen'}).count(), 0);
    // Signing out unmounts the screen, which stops trying again.
    let calls = 0;
    page.on('request', (request) => (calls += /Usage/.test(request.postData() ?? '') ? 1 : 0));
    await page.getByRole('button', {name: 'Abmelden'}).click();
    await page.waitForTimeout(5500);
    assert.equal(calls, 0);
    assert.deepEqual(problems, []);
    await context.close();
  });

  test('with its database the charts run up to now, zoom by dragging and take a custom range', async () => {
    // The collector's minute passes in 3 s, so rows reach the database at once.
    const {url} = await system({resourcemonitor_history: 'yes'}, {database: true, statdOptions: '--time-scale 0.05'});
    const {context, page, problems} = await openPage(browser, `${url}#/history`);
    await signIn(page);
    const caption = page.locator('.history-caption');
    await caption.getByText('history in steps of 1 min').waitFor({timeout: 20000});
    const cpu = page.locator('[data-chart="cpu"] .u-over');
    const box = await cpu.boundingBox();
    // The newest point comes from the real-time samples, within seconds of the end.
    await waitFor(async () => {
      await page.mouse.move(box.x + box.width - 1, box.y + box.height / 2);
      const [range, time, busy] = await Promise.all([caption.textContent(),
        page.locator('[data-chart="cpu"] .u-legend .u-series').nth(0).locator('.u-value').textContent(),
        page.locator('[data-chart="cpu"] .u-legend .u-series').nth(1).locator('.u-value').textContent()]);
      const end = seconds(range.split(' – ')[1]);
      return /\d %$/.test(busy) && end - seconds(time) <= 30;
    }, 'the CPU line to reach the end of the hour');
    await screenshot(page, 'history-data');

    await page.mouse.move(box.x + box.width * 0.5, box.y + 20);
    await page.mouse.down();
    await page.mouse.move(box.x + box.width * 0.95, box.y + 20, {steps: 5});
    await page.mouse.up();
    await page.getByRole('button', {name: 'Zoom out'}).waitFor();
    const [from, to] = (await caption.textContent()).split(' · ')[0].split(' – ').map(seconds);
    assert.ok(to - from > 1500 && to - from < 1800, `zoomed to ${to - from} s`);
    await page.getByRole('button', {name: 'Reset zoom'}).click();
    await page.getByRole('button', {name: 'Zoom out'}).waitFor({state: 'hidden'});

    await page.getByRole('button', {name: 'Custom'}).press('Enter');
    assert.equal(await page.evaluate(() => document.activeElement.id), 'history-from');
    await page.getByLabel('From', {exact: true}).fill('2020-11-24T12:00');
    await page.getByLabel('To', {exact: true}).fill('2020-11-24T11:00');
    await page.getByRole('button', {name: 'Show'}).click();
    await page.getByText('Enter a start that comes before the end.').waitFor();
    await page.getByLabel('To', {exact: true}).fill('2020-11-24T13:30');
    await page.getByRole('button', {name: 'Show'}).click();
    await caption.getByText('24/11/2020, 12:00:00 – 24/11/2020, 13:30:00 · no usage was recorded in this time.').waitFor();
    assert.equal(await page.getByRole('button', {name: 'Custom'}).getAttribute('aria-pressed'), 'true');
    assert.deepEqual(problems, []);
    await context.close();
  });
});
