// The services screen against the real collector: the running services of
// the root by their display names, ordered by CPU and by memory, the top ten
// and all of them, and one that stops leaving.

import assert from 'node:assert/strict';
import {writeFileSync} from 'node:fs';
import {join} from 'node:path';
import {after, before, test} from 'node:test';
import {apiSession, launchBrowser, openPage, screenshot, signIn, startSystem, waitFor} from './system.mjs';

// A service that burns a CPU and ten that sleep: twelve with kovastatd. By
// name alone, the burner would come after the sleepers.
const kServices = [['burner', 'Spinner', '/bin/sh -c "while :; do :; done"']];
for (let i = 1; i <= 10; i += 1) kServices.push([`sleeper${i}`, `Sleeper ${i}`, '/bin/sleep 300']);

let system;
let browser;
before(async () => {
  system = await startSystem();
  for (const [name, display, command] of kServices) {
    writeFileSync(join(system.root, 'etc/kova/services', `${name}.conf`),
                  `command="${command}"\ndisplay_name="${display}"\n`);
    system.kova(['service', 'start', name]);
  }
  browser = await launchBrowser();
  // A service's CPU joins the catalog from the collector's second pass after its start.
  const call = await apiSession(system);
  await waitFor(async () => (await call('KOVA.ResourceMonitor.Usage', 'catalog'))
    .series.some((one) => one.id === 'service.cpu@burner'), 'the burner in the catalog');
});
after(async () => {
  await browser?.close();
  for (const [name] of kServices) {
    try {
      system?.kova(['service', 'stop', name]);
    } catch {
      // Not running.
    }
  }
  await system?.stop();
});

test('the top list orders services by CPU, by memory when asked, and shows all of them on demand', async () => {
  const {context, page, problems} = await openPage(browser, system.url);
  await signIn(page);
  await page.getByRole('link', {name: 'Services'}).click();
  const rows = page.locator('.services-table tbody tr');
  const names = () => rows.evaluateAll((list) => list.map((row) => row.dataset.service));

  // The burner leads by CPU, and only ten of twelve show.
  await waitFor(async () => (await names())[0] === 'burner' && /Spinner.*[1-9]\d* %/.test(await rows.first().textContent()),
                'the burner on top by CPU');
  assert.equal(await rows.count(), 10);
  const cpu = page.getByRole('columnheader', {name: 'CPU'});
  const memory = page.getByRole('columnheader', {name: 'Memory'});
  assert.equal(await cpu.getAttribute('aria-sort'), 'descending');
  await screenshot(page, 'services');

  // kovastatd holds more memory than a shell or a sleep.
  await page.getByRole('button', {name: 'Memory'}).focus();
  await page.keyboard.press('Enter');
  await waitFor(async () => (await names())[0] === 'kovastatd', 'kovastatd on top by memory');
  assert.match(await rows.first().textContent(), /Usage statistics.*\d (KiB|MiB)$/);
  assert.equal(await memory.getAttribute('aria-sort'), 'descending');
  assert.equal(await cpu.getAttribute('aria-sort'), null);

  await page.getByRole('button', {name: 'Show all 12'}).click();
  assert.equal(await rows.count(), 12);
  // A stopped service leaves the list, though its samples are still in the window.
  system.kova(['service', 'stop', 'sleeper10']);
  await waitFor(async () => !(await names()).includes('sleeper10'), 'the stopped service to leave');
  assert.equal(await rows.count(), 11);
  await page.getByRole('button', {name: 'Show the top 10'}).click();
  assert.equal(await rows.count(), 10);

  await page.setViewportSize({width: 390, height: 844});
  assert.ok(await page.evaluate(() => document.documentElement.scrollWidth <= 390));
  await screenshot(page, 'services-phone');
  assert.deepEqual(problems, []);
  await context.close();
});
