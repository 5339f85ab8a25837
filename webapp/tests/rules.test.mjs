// The rules screen: a rule made, previewed, changed and switched through the
// dialog and the list, checked against the API; the layout at phone width; two
// rules deleted at once. The tests run in order on one system.

import assert from 'node:assert/strict';
import {test} from 'node:test';
import {openPage, screenshot, signIn, useSystem, waitFor} from './system.mjs';

let system;
let browser;
useSystem({}, (started) => ({system, browser} = started));

async function openRules(viewport) {
  const opened = await openPage(browser, system.url, {viewport});
  opened.context.setDefaultTimeout(10000);
  await signIn(opened.page);
  await opened.page.getByRole('link', {name: 'Rules'}).click();
  await opened.page.getByRole('button', {name: 'New rule'}).waitFor();
  return opened;
}

// A method of the rule API, called in the page with its session.
const ruleApi = (page, method, params = {}) => page.evaluate(async ([method, params]) => {
  const {call} = await import('/js/api.js');
  return call('KOVA.ResourceMonitor.EventRule', method, params);
}, [method, params]);

const points = (dialog) => dialog.locator('.rule-chart').getAttribute('data-points').then(Number);

test('a rule is made with a preview, changed and switched off and on', async () => {
  const {context, page, problems} = await openRules({width: 1280, height: 800});
  await page.getByText('No rules yet.').waitFor();
  // The collector lists a service once it has measured it.
  await waitFor(() => page.evaluate(async () => (await (await import('/js/usage.js')).catalog({fresh: true}))
    .series.some((one) => one.id === 'service.cpu@kovastatd')), 'kovastatd in the catalog');

  await page.getByRole('button', {name: 'New rule'}).click();
  const dialog = page.getByRole('dialog', {name: 'New rule'});
  assert.equal(await page.evaluate(() => document.activeElement.id), 'rule-object');
  await dialog.getByLabel('Object').selectOption({label: 'Usage statistics'});
  assert.deepEqual(await dialog.getByLabel('Resource').locator('option').allTextContents(), ['CPU', 'Memory']);
  await dialog.getByLabel('Threshold').fill('150');
  await dialog.getByRole('button', {name: 'Save'}).click();
  await dialog.getByText('Enter a whole number from 0 to 100.').waitFor();
  await dialog.getByLabel('Threshold').fill('80');
  assert.equal(await dialog.locator('.rule-chart').getAttribute('data-threshold'), '80');
  await waitFor(async () => (await points(dialog)) >= 3, 'the preview to show the service');
  await screenshot(page, 'rules-dialog');
  await dialog.getByRole('button', {name: 'Save'}).click();
  await page.getByRole('cell', {name: 'Usage statistics', exact: true}).waitFor();
  assert.equal(await dialog.count(), 0);
  const [made] = (await ruleApi(page, 'list')).rules;
  assert.deepEqual({...made, id: undefined}, {id: undefined, enable: true, service: 'kovastatd',
    name: 'Usage statistics', type: 1, severity: 1, resource: 1, threshold: 80});

  // The system's memory: the preview is the share of memory in use, and a
  // second rule of the same object, resource and severity is refused in words.
  for (const attempt of ['first', 'again']) {
    await page.getByRole('button', {name: 'New rule'}).click();
    await dialog.getByLabel('Resource').selectOption({label: 'Memory'});
    await dialog.getByLabel('Threshold').fill('95');
    await waitFor(async () => (await points(dialog)) > 0, 'the memory preview');
    const shown = Number(await dialog.locator('.rule-chart').getAttribute('data-last'));
    const memory = await page.evaluate(async () => {
      const {realtime} = await import('/js/usage.js');
      const {series} = await realtime(['mem.used', 'mem.total']);
      return 100 * series.get('mem.used').values.at(-1) / series.get('mem.total').values.at(-1);
    });
    assert.ok(Math.abs(shown - memory) < 1, `preview ${shown} % against ${memory} %`);
    await dialog.getByRole('button', {name: 'Save'}).click();
    if (attempt === 'again') {
      await dialog.getByText('A rule for this object, resource and severity exists already.').waitFor();
      await page.keyboard.press('Escape');
    }
    await page.getByRole('cell', {name: 'Whole system', exact: true}).waitFor();
    assert.equal(await dialog.count(), 0);
  }

  await page.getByRole('button', {name: 'Edit Usage statistics, CPU, Warning'}).click();
  const change = page.getByRole('dialog', {name: 'Edit rule'});
  assert.equal(await change.getByLabel('Threshold').inputValue(), '80');
  await change.getByLabel('Threshold').fill('90');
  await change.getByLabel('Severity').selectOption({label: 'Critical'});
  await change.getByRole('button', {name: 'Save'}).click();
  const row = page.getByRole('row').filter({hasText: 'Usage statistics'});
  await row.getByText('Critical').waitFor();
  assert.match(await row.textContent(), /90 %/);
  assert.deepEqual({...await ruleApi(page, 'get', {id: made.id})}, {...made, severity: 2, threshold: 90});

  const onOff = page.getByRole('switch', {name: 'Enabled: Usage statistics, CPU, Critical'});
  for (const enable of [false, true]) {
    await onOff.click();
    await row.getByText(enable ? 'On' : 'Off', {exact: true}).waitFor();
    assert.equal(await onOff.isChecked(), enable);
    assert.equal((await ruleApi(page, 'get', {id: made.id})).enable, enable);
  }
  await screenshot(page, 'rules-list');
  assert.deepEqual(problems, []);
  await context.close();
});

test('the list and the dialog fit a phone', async () => {
  const {context, page, problems} = await openRules({width: 390, height: 844});
  await page.getByRole('cell', {name: 'Whole system', exact: true}).waitFor();
  assert.ok(await page.evaluate(() => document.documentElement.scrollWidth <= innerWidth));
  await screenshot(page, 'rules-phone');
  await page.getByRole('button', {name: 'Edit Whole system, Memory, Warning'}).click();
  const dialog = page.getByRole('dialog', {name: 'Edit rule'});
  await waitFor(async () => (await points(dialog)) > 0, 'the preview');
  const box = await dialog.boundingBox();
  assert.ok(box.x >= 0 && box.x + box.width <= 390, `dialog from ${box.x} to ${box.x + box.width}`);
  await screenshot(page, 'rules-dialog-phone');
  await page.keyboard.press('Escape');
  assert.equal(await dialog.count(), 0);
  assert.deepEqual(problems, []);
  await context.close();
});

test('two selected rules are deleted after confirming', async () => {
  const {context, page, problems} = await openRules({width: 1280, height: 800});
  await page.getByRole('checkbox', {name: 'Select Usage statistics, CPU, Critical'}).check();
  await page.getByRole('checkbox', {name: 'Select Whole system, Memory, Warning'}).check();
  assert.ok(await page.getByRole('checkbox', {name: 'Select all'}).isChecked());
  await page.getByText('2 selected').waitFor();
  await page.getByRole('button', {name: 'Delete'}).click();
  await page.getByRole('dialog', {name: 'Delete the selected rules (2)?'}).getByRole('button', {name: 'Delete'}).click();
  await page.getByText('No rules yet.').waitFor();
  assert.equal((await ruleApi(page, 'list')).total, 0);
  assert.ok(await page.getByRole('button', {name: 'Delete'}).isDisabled());
  assert.deepEqual(problems, []);
  await context.close();
});
