// Measures the web app in chromium over a real kova-webapid and kovastatd; run
// by bench/webapp_bench.sh, which passes the programs' paths.
//   node webapp_bench.mjs MINUTES

import {launchBrowser, openPage, signIn, startSystem, waitFor} from '../webapp/tests/system.mjs';

const minutes = Number(process.argv[2] ?? 10);
const kTimeScale = 0.05;  // the collector's clock runs 20 times as fast
const kFullWindow = 3600;  // samples in an hour's reach
const kUpdatesTimed = 60;

const median = (values) => [...values].sort((a, b) => a - b)[Math.floor(values.length / 2)];
const quantile = (values, q) => [...values].sort((a, b) => a - b)[Math.min(values.length - 1, Math.floor(values.length * q))];
const kb = (bytes) => `${(bytes / 1024).toFixed(1)} KB`;

const system = await startSystem({
  settings: {resourcemonitor_realtime_max: '60'},
  statdOptions: `--time-scale ${kTimeScale}`,
});
const browser = await launchBrowser();
let failed = false;
try {
  // First load: every HTML, script and style answer from the sign-in to the
  // overview's charts, uncompressed as the host sends them.
  // Tall enough that every chart is on screen and drawn on each update.
  const {page, problems} = await openPage(browser, 'about:blank', {viewport: {width: 1280, height: 3000}});
  const loaded = new Map();
  page.on('response', async (response) => {
    const type = response.request().resourceType();
    if (!['document', 'script', 'stylesheet'].includes(type)) return;
    const body = await response.body().catch(() => Buffer.alloc(0));
    loaded.set(response.url(), body.length);
  });
  await page.goto(system.url);
  await signIn(page);
  await page.locator('[data-chart][data-points]').first().waitFor();
  const total = [...loaded.values()].reduce((a, b) => a + b, 0);
  const uplot = [...loaded].filter(([url]) => url.includes('/lib/uPlot')).reduce((a, [, n]) => a + n, 0);
  if (uplot === 0) throw new Error('uPlot was not loaded');
  console.log(`first load: ${kb(total)} in ${loaded.size} files (target under 200 KB); ` +
              `uPlot alone ${kb(uplot)}; ratio ${(total / uplot).toFixed(2)}`);

  // Update time, once the charts hold an hour.
  const points = () => page.evaluate(() =>
    Math.min(...[...document.querySelectorAll('[data-chart][data-points]')].map((card) => Number(card.dataset.points))));
  console.log('waiting for an hour of samples in every chart');
  await waitFor(async () => (await points()) >= kFullWindow - 5, 'full charts', 10 * 60 * 1000);
  const cdp = await page.context().newCDPSession(page);
  await cdp.send('Performance.enable');
  const metric = async (name) => (await cdp.send('Performance.getMetrics')).metrics.find((m) => m.name === name).value;
  await page.evaluate(() => performance.clearMeasures());
  const scriptBefore = await metric('ScriptDuration');
  const updatesBefore = await page.evaluate(() => Number(document.querySelector('.screen').dataset.updates ?? 0));
  await waitFor(() => page.evaluate((n) => performance.getEntriesByName('overview-update').length >= n, kUpdatesTimed),
                `${kUpdatesTimed} updates`, 5 * 60 * 1000);
  const scriptAfter = await metric('ScriptDuration');
  const updates = await page.evaluate(() => performance.getEntriesByName('overview-update').map((entry) => entry.duration));
  const shape = await page.evaluate(() => ({
    series: Number(document.querySelector('.screen').dataset.series ?? 0),
    points: Math.max(...[...document.querySelectorAll('[data-chart][data-points]')].map((card) => Number(card.dataset.points))),
  }));
  const updatesAfter = await page.evaluate(() => Number(document.querySelector('.screen').dataset.updates ?? 0));
  const perUpdateCdp = ((scriptAfter - scriptBefore) * 1000) / Math.max(1, updatesAfter - updatesBefore);

  // The baseline: uPlot alone drawing the same number of series and points,
  // in the same page, one setData a turn.
  const baseline = await page.evaluate(async ({series, points, turns}) => {
    const box = document.createElement('div');
    document.body.append(box);
    const times = Float64Array.from({length: points}, (_, i) => 1.7e9 + i);
    const columns = Array.from({length: series}, (_, s) => Float64Array.from({length: points}, (_, i) => Math.sin(i / 50 + s) * 50 + 50));
    const plot = new uPlot({width: 1000, height: 200, series: [{}, ...columns.map(() => ({stroke: 'red'}))]},
                           [times, ...columns], box);
    const durations = [];
    for (let turn = 0; turn < turns; ++turn) {
      const start = performance.now();
      plot.setData([times, ...columns]);
      await Promise.resolve();
      durations.push(performance.now() - start);
      await new Promise((resolve) => setTimeout(resolve, 20));
    }
    plot.destroy();
    box.remove();
    return durations;
  }, {series: shape.series, points: shape.points, turns: kUpdatesTimed});
  console.log(`update of ${shape.series} series x ${shape.points} points: median ${median(updates).toFixed(2)} ms, ` +
              `p95 ${quantile(updates, 0.95).toFixed(2)} ms (target under 4 ms); script time a second by ` +
              `chromium's metrics ${perUpdateCdp.toFixed(2)} ms; uPlot alone median ` +
              `${median(baseline).toFixed(2)} ms; ratio ${(median(updates) / median(baseline)).toFixed(2)}`);

  // Heap over the minutes of live updates, after a garbage collection each time.
  const heap = async () => {
    await cdp.send('HeapProfiler.collectGarbage');
    return (await cdp.send('Runtime.getHeapUsage')).usedSize;
  };
  const sizes = [await heap()];
  for (let minute = 1; minute <= minutes; ++minute) {
    await new Promise((resolve) => setTimeout(resolve, 60000));
    sizes.push(await heap());
    console.log(`heap after ${minute} min: ${kb(sizes.at(-1))}`);
  }
  const growth = sizes.at(-1) / sizes[1];
  console.log(`heap after ${minutes} min ${kb(sizes.at(-1))} against ${kb(sizes[1])} after 1 min: ` +
              `ratio ${growth.toFixed(3)} (target within 10 %)`);
  if (problems.length) {
    console.error(`the page reported problems:\n${problems.join('\n')}`);
    failed = true;
  }
} finally {
  await browser.close();
  await system.stop();
}
process.exit(failed ? 1 : 0);
