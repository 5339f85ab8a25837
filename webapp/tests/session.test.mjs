// Sign-in, sign-out and an expired session, in English and German; in German
// also the settings' refusal of history without a database.

import assert from 'node:assert/strict';
import {test} from 'node:test';
import {openPage, screenshot, signIn, useSystem, waitFor} from './system.mjs';

let system;
let browser;
useSystem({}, (started) => ({system, browser} = started));

test('a wrong password is refused in words, the right one signs in, sign-out returns', async () => {
  const {context, page, problems} = await openPage(browser, system.url);
  await page.getByLabel('Account').fill('admin');
  await page.getByLabel('Password').fill('not the password');
  await page.getByRole('button', {name: 'Sign in'}).click();
  await page.getByText('Wrong account name or password.').waitFor();
  await screenshot(page, 'signin-refused');

  await signIn(page);
  assert.equal(await page.locator('#account').textContent(), 'admin');
  await page.getByRole('button', {name: 'Sign out'}).click();
  await page.getByText('You have signed out.').waitFor();
  assert.equal(await page.getByRole('navigation', {name: 'Screens'}).count(), 0);
  // The token lived in the page only: nothing of the session is kept in storage.
  assert.deepEqual(await page.evaluate(() => [localStorage.length, sessionStorage.length]), [0, 0]);
  assert.deepEqual(problems, []);
  await context.close();
});

test('in German, a setting refused says why, and a session that ends on the server brings back the sign-in with the reason', async () => {
  const {context, page, problems} = await openPage(browser, system.url, {locale: 'de-DE'});
  await page.getByLabel('Konto').fill('admin');
  await page.getByLabel('Passwort').fill('browser test password');
  await page.getByRole('button', {name: 'Anmelden'}).click();
  await page.getByRole('navigation', {name: 'Ansichten'}).waitFor();
  // No volume holds the database: history stays off, and the form reads back.
  await page.getByRole('link', {name: 'Einstellungen'}).click();
  const history = page.getByLabel('Verlauf aufzeichnen');
  await history.check();
  await page.getByRole('button', {name: 'Übernehmen'}).click();
  await page.getByRole('alert').getByText('Kein Volume enthält die Verlaufsdatenbank.').waitFor();
  await waitFor(async () => !(await history.isChecked()), 'the form read back');
  await screenshot(page, 'settings-error-de');
  // From a screen that doesn't poll, so that the next call is the click's.
  await context.clearCookies();
  await page.getByRole('link', {name: 'Ereignisprotokoll'}).click();
  await page.getByText('Ihre Sitzung ist abgelaufen. Bitte melden Sie sich erneut an.').waitFor();
  await screenshot(page, 'signin-expired-de');
  assert.deepEqual(problems, []);
  await context.close();
});

test('a screen left while it loads stops at once; a browser clock 20 minutes fast still sees samples', async () => {
  const {context, page, problems} = await openPage(browser, 'about:blank');
  await page.clock.install({time: Date.now() + 20 * 60 * 1000});
  await page.goto(system.url);
  const polls = [];
  page.on('request', (request) => {
    if (request.postData()?.includes('method=realtime')) polls.push(Date.now());
  });
  await signIn(page);
  const card = page.locator('[data-chart="cpu"]');
  await page.waitForFunction(() => Number(document.querySelector('[data-chart="cpu"]')?.dataset.points) > 0);
  // The overview comes up while the log still waits for its list.
  await page.route('**/webapi/entry.cgi', async (route) => {
    if (/api=KOVA.ResourceMonitor.Log&version=1&method=list/.test(route.request().postData())) {
      await new Promise((resolve) => setTimeout(resolve, 800));
    }
    await route.continue();
  });
  await page.getByRole('link', {name: 'Event log'}).click();
  await page.getByRole('link', {name: 'Overview'}).click();
  await page.waitForTimeout(1500);
  await page.getByRole('link', {name: 'Settings'}).click();
  await page.getByLabel('Real-time range').waitFor();
  const settled = Date.now();
  await new Promise((resolve) => setTimeout(resolve, 2500));
  assert.deepEqual(polls.filter((time) => time > settled + 500), []);
  assert.equal(await card.count(), 0);
  assert.deepEqual(problems, []);
  await context.close();
});
