// The event log screen: pages newest first, filters, export and clearing, at
// desk and phone width.

import assert from 'node:assert/strict';
import {readFileSync} from 'node:fs';
import {test} from 'node:test';
import {openPage, screenshot, signIn, useSystem, waitFor} from './system.mjs';

let system, browser, page, problems;
let boundary;  // the Unix second from which on the two later events were written
const write = (level, text) =>
  system.kova(['log', 'write', '--user', 'system', '--source', 'kovaperfeventd', level, text]);
// Unix seconds as a datetime-local value in the local zone, the browser's too.
const inputValue = (seconds) => new Date(seconds * 1000).toLocaleString('sv-SE').replace(' ', 'T');
const kLater = ['Memory usage at 99%', 'Network usage back to normal'];

// Waits until the pager says `range` and the table is read; its events.
async function shows(range) {
  const table = page.getByRole('table', {name: 'Performance events'});
  await waitFor(async () => await page.locator('.log-range').textContent() === range &&
                            await table.getAttribute('aria-busy') === null, `the range ${range}`);
  return table.locator('tbody td:nth-child(3)').allTextContents();
}

useSystem({}, async (started) => {
  ({system, browser} = started);
  for (let i = 1; i <= 25; i += 1) write('Warning', `Disk latency at ${i} ms`);
  boundary = Math.floor(Date.now() / 1000) + 1;
  await new Promise((resolve) => setTimeout(resolve, boundary * 1000 - Date.now() + 50));
  write('Critical', kLater[0]);
  write('Info', kLater[1]);
  ({page, problems} = await openPage(browser, system.url));
  await signIn(page);
  await page.getByRole('link', {name: 'Event log'}).click();
});

test('events are listed newest first a page at a time and filtered by level, keyword and time', async () => {
  assert.deepEqual((await shows('1–25 of 27')).slice(0, 2).sort(), kLater);
  const badge = page.getByRole('row', {name: /Memory usage/}).locator('.level-Critical');
  assert.equal(await badge.textContent(), 'Critical');
  await screenshot(page, 'log');

  const [previous, next] = ['Previous', 'Next'].map((name) => page.getByRole('button', {name}));
  assert.ok(await previous.isDisabled());
  await next.click();
  assert.ok((await shows('26–27 of 27')).every((event) => /^Disk latency/.test(event)));
  assert.ok(await next.isDisabled());
  await previous.click();
  await shows('1–25 of 27');

  await page.getByLabel('Level').selectOption('Critical');
  assert.deepEqual(await shows('1–1 of 1'), [kLater[0]]);
  await page.getByLabel('Level').selectOption('');
  await page.getByLabel('Keyword').fill('NETWORK');
  await page.getByLabel('Keyword').press('Enter');
  assert.deepEqual(await shows('1–1 of 1'), [kLater[1]]);
  await page.getByLabel('Keyword').fill('');
  await page.getByLabel('From').fill(inputValue(boundary));
  assert.deepEqual((await shows('1–2 of 2')).sort(), kLater);
  await page.getByLabel('From').fill('');
  await page.getByLabel('To').fill(inputValue(boundary - 1));
  assert.ok((await shows('1–25 of 25')).every((event) => /^Disk latency/.test(event)));
  await page.getByLabel('To').fill('');
  await shows('1–25 of 27');

  // On a phone the page keeps its width; the table scrolls in its frame.
  await page.setViewportSize({width: 390, height: 844});
  await screenshot(page, 'log-phone');
  assert.ok(await page.evaluate(() => document.documentElement.scrollWidth <= 390));
  await page.setViewportSize({width: 1280, height: 800});
  assert.deepEqual(problems, []);
});

test('exports are saved under the server\'s name with the filter applied', async () => {
  async function saved(button, type) {
    const [download] = await Promise.all([page.waitForEvent('download'),
                                          page.getByRole('button', {name: button}).click()]);
    assert.match(download.suggestedFilename(), new RegExp(`^ResourceMonitor-\\d{4}(-\\d{2}){5}\\.${type}$`));
    return readFileSync(await download.path(), 'utf8');
  }
  await page.getByLabel('Level').selectOption('Critical');
  await shows('1–1 of 1');
  const csv = (await saved('Export CSV', 'csv')).split('\r\n');
  assert.equal(csv[0], 'Time,Level,Event,');
  assert.match(csv[1], /^\d{4}\/\d{2}\/\d{2} \d{2}:\d{2}:\d{2},Critical,Memory usage at 99%,$/);
  assert.equal(csv.length, 3);

  await page.getByLabel('Level').selectOption('');
  await shows('1–25 of 27');
  const html = await saved('Export HTML', 'html');
  assert.equal(html.split('\n')[0], '<html><head>');
  assert.equal(html.match(/<tr>/g).length, 28);
  assert.deepEqual(problems, []);
});

test('clearing asks first and then shows the empty log', async () => {
  const dialogButton = (name) => page.getByRole('dialog').getByRole('button', {name});
  await page.getByRole('button', {name: 'Clear log'}).click();
  await dialogButton('Cancel').click();
  assert.equal((await shows('1–25 of 27')).length, 25);

  await page.getByRole('button', {name: 'Clear log'}).click();
  await dialogButton('Clear log').click();
  await page.getByRole('cell', {name: 'No events'}).waitFor();
  assert.ok(await page.getByRole('navigation', {name: 'Pages'}).isHidden());
  assert.equal(system.kova(['log', 'dump']), '');
  await page.locator('#status').evaluate((status) => Promise.all(status.getAnimations().map((a) => a.finished)));
  await screenshot(page, 'log-cleared');
  assert.deepEqual(problems, []);
});
