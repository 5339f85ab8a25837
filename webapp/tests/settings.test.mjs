// The settings screen: it shows and stores the settings, and says in words
// why history can't be switched on without a database (in German: session.test.mjs).

import assert from 'node:assert/strict';
import {readFileSync} from 'node:fs';
import {join} from 'node:path';
import {test} from 'node:test';
import {openPage, screenshot, signIn, useSystem, waitFor} from './system.mjs';

let system, browser;
useSystem({settings: {resourcemonitor_realtime_max: '30', resourcemonitor_performance_event: 'yes'}},
          (started) => ({system, browser} = started));

// A setting as /etc/kovainfo.conf holds it.
const stored = (key) =>
  new RegExp(`^${key}="([^"]*)"`, 'm').exec(readFileSync(join(system.root, 'etc/kovainfo.conf'), 'utf8'))?.[1];

test('the form shows the stored settings, applies changes and says why history stays off', async () => {
  const {context, page, problems} = await openPage(browser, system.url);
  await signIn(page);
  await page.getByRole('link', {name: 'Settings'}).click();
  const [range, history, events] =
    ['Real-time range', 'Record history', 'Performance events'].map((name) => page.getByLabel(name));
  const apply = page.getByRole('button', {name: 'Apply'});
  await waitFor(async () => await range.inputValue() === '30', 'the stored range');
  assert.deepEqual([await history.isChecked(), await events.isChecked(), await apply.isDisabled()],
                   [false, true, true]);

  // Each apply is confirmed and read back: the button waits for the next change.
  async function applied(key, value) {
    await apply.click();
    await page.getByText('The settings have been saved.').waitFor();
    await waitFor(() => apply.isDisabled(), 'the form read back');
    assert.equal(stored(key), value);
  }
  await range.selectOption('60');
  await applied('resourcemonitor_realtime_max', '60');
  await events.uncheck();
  await applied('resourcemonitor_performance_event', 'no');
  assert.equal(await events.isChecked(), false);
  await events.check();
  await applied('resourcemonitor_performance_event', 'yes');

  // History fails first, so the range of the same apply isn't stored either.
  await range.selectOption('120');
  await history.check();
  await apply.click();
  await page.getByRole('form').getByRole('alert').getByText('No volume holds the history database.').waitFor();
  await waitFor(async () => await range.inputValue() === '60', 'the range read back');
  assert.equal(await history.isChecked(), false);
  assert.equal(stored('resourcemonitor_realtime_max'), '60');
  await page.locator('#status').evaluate((status) => Promise.all(status.getAnimations().map((a) => a.finished)));
  await screenshot(page, 'settings-error');
  assert.deepEqual(problems, []);
  await context.close();
});
