// The page's conversions, run in the browser as the page runs them: binary
// prefixes, the log's server-local times, axis labels.

import assert from 'node:assert/strict';
import {test} from 'node:test';
import {openPage, useSystem} from './system.mjs';

let page;
useSystem({}, async ({system, browser}) => {
  ({page} = await openPage(browser, system.url));
});

// Evaluates `body` in the page with the module at `path` as `m`.
const inPage = (path, body) =>
  page.evaluate(async ([path, body]) => new Function('m', `return ${body}`)(await import(path)), [path, body]);

test('values are written with binary prefixes and the unit', async () => {
  const cases = [
    ['formatValue(0, "B")', '0 B'],
    ['formatValue(1023, "B")', '1,023 B'],
    ['formatValue(1536, "B/s")', '1.5 KiB/s'],
    ['formatValue(10 * 1024 * 1024, "B")', '10 MiB'],
    ['formatValue(123.4 * 1024 ** 3, "B")', '123 GiB'],
    ['formatValue(5 * 1024 ** 4, "B")', '5 TiB'],
    ['formatValue(-2048, "B/s")', '-2 KiB/s'],
    ['formatValue(42.4, "%")', '42 %'],
    ['formatValue(4.44, "%")', '4.4 %'],
    ['formatValue(null, "%")', '–'],
    ['formatValue(NaN, "B")', '–'],
    ['formatValue(3, "IO/s")', '3 IO/s'],
  ];
  for (const [expression, expected] of cases) {
    assert.equal(await inPage('/js/format.js', `m.${expression}`), expected, expression);
  }
});

test("the log's server-local times become instants with the server's offset", async () => {
  const utc = Date.UTC(2026, 10, 24, 13, 7, 9) / 1000;
  const cases = [
    ['"2026/11/24 13:07:09", 0', utc],
    ['"2026/11/24 13:07:09", 3600', utc - 3600],      // the server an hour east of UTC
    ['"2026/11/24 13:07:09", -18000', utc + 18000],   // five hours west
    ['"2026/11/24 13:07", 0', null],                  // no seconds: not a log time
    ['"", 0', null],
  ];
  for (const [args, expected] of cases) {
    const got = await inPage('/js/usage.js', `m.logTimeToSeconds(${args})`);
    assert.equal(Number.isNaN(got) ? null : got, expected, args);
  }
});

test('a time axis gives the date under its first tick and under each new day', async () => {
  const start = await page.evaluate(() => new Date(2026, 10, 24, 23, 58).getTime() / 1000);
  const labels = await inPage('/js/format.js', `m.formatAxisTimes([${start}, ${start + 60}, ${start + 120}, ${start + 180}], 60)`);
  assert.deepEqual(labels, ['23:58\n24/11', '23:59', '00:00\n25/11', '00:01']);
  assert.deepEqual(await inPage('/js/format.js', `m.formatAxisTimes([${start}], 86400)`), ['24/11']);
});
