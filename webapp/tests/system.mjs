// For the browser tests: a KOVA system over a temporary root (kova-webapid with
// both modules, kovastatd and kovaperfeventd as platform services, an
// administrator) and Debian's chromium driven by playwright-core. The build
// passes the programs' paths in the environment (webapp/CMakeLists.txt).

import {execFileSync, spawn} from 'node:child_process';
import {chmodSync, cpSync, mkdirSync, mkdtempSync, readFileSync, rmSync, symlinkSync, writeFileSync} from 'node:fs';
import {tmpdir} from 'node:os';
import {basename, dirname, join} from 'node:path';
import {fileURLToPath} from 'node:url';
import {after, before} from 'node:test';
import {chromium} from 'playwright-core';

export const kAccount = 'admin';
export const kPassword = 'browser test password';
export const screenshots = process.env.KOVA_SCREENSHOTS ?? join(tmpdir(), 'kova-screenshots');

function need(name) {
  const value = process.env[name];
  if (!value) throw new Error(`${name} is not set; run the browser tests through ctest`);
  return value;
}

const sleep = (ms) => new Promise((resolve) => setTimeout(resolve, ms));

// Waits until `check()` gives a true value, for up to `ms`; returns it or throws `what`.
export async function waitFor(check, what, ms = 15000) {
  const deadline = Date.now() + ms;
  for (;;) {
    const value = await check();
    if (value) return value;
    if (Date.now() > deadline) throw new Error(`timed out waiting for ${what}`);
    await sleep(100);
  }
}

// Starts the system. `settings` are lines of /etc/kovainfo.conf;
// `perfeventTimeScale` runs the event daemon's periods and windows faster;
// `statdOptions` go to kovastatd ("--time-scale 0.05": a minute in 3 s);
// `database` starts the real PostgreSQL as the service "pgsql" first (as root,
// it runs as the account kovapgsql that scripts/setup makes).
export async function startSystem({settings = {}, perfeventTimeScale = 0.1, statdOptions = '',
                                   database = false} = {}) {
  const root = mkdtempSync(join(tmpdir(), 'kova-browser-'));
  chmodSync(root, 0o755);  // a host started as root reads the root as its account
  const env = {...process.env, KOVA_ROOT: root};
  const kova = (args, input = '') =>
    execFileSync(need('KOVA_TOOL'), args, {env, input, encoding: 'utf8'});
  for (const dir of ['etc/kova/services', 'run/kova', 'tmp', 'var/log', 'modules', 'usr/share/kova']) {
    mkdirSync(join(root, dir), {recursive: true});
  }
  chmodSync(join(root, 'tmp'), 0o1777);  // like /tmp: modules make their copies there
  cpSync(need('KOVA_TEXTS'), join(root, 'usr/share/kova/texts'), {recursive: true});
  for (const module of need('KOVA_MODULES').split(':')) {
    symlinkSync(module, join(root, 'modules', basename(module)));
  }
  const conf = {
    language: 'enu', resourcemonitor_realtime_max: '15', resourcemonitor_history: 'no',
    resourcemonitor_performance_event: 'no', support_performance_event_internal: 'yes', ...settings,
  };
  writeFileSync(join(root, 'etc/kovainfo.conf'),
                Object.entries(conf).map(([key, value]) => `${key}="${value}"\n`).join(''));
  kova(['user', 'add', kAccount, '--admin'], `${kPassword}\n`);
  const install = (name, program, options) => execFileSync(need('KOVA_INSTALL_SERVICE'), [
    root, name, '/bin/sh', '-c', `exec ${program} ${options} --log-stderr 2>>${root}/${name}.err`,
  ], {env, stdio: 'ignore'});
  if (database) {
    const pgsql = process.env.KOVA_PGSQL_DIR ?? join(dirname(fileURLToPath(import.meta.url)), '../../daemons/pgsql');
    mkdirSync(join(root, 'usr/sbin'), {recursive: true});
    cpSync(join(pgsql, 'kova-pgsql'), join(root, 'usr/sbin/kova-pgsql'));
    execFileSync(join(pgsql, 'install-service.sh'), [root], {env, stdio: 'ignore'});
    kova(['service', 'start', 'pgsql']);
  }
  install('kovastatd', need('KOVASTATD'), statdOptions);
  install('kovaperfeventd', need('KOVAPERFEVENTD'), `--time-scale ${perfeventTimeScale}`);
  kova(['service', 'start', 'kovastatd']);

  const hostLog = join(root, 'host.log');
  const host = spawn(need('KOVA_WEBAPID'), ['--port', '0', '--modules', join(root, 'modules'),
                                            '--static', need('KOVA_WWW')],
                     {env, stdio: ['ignore', 'ignore', 'pipe']});
  let log = '';
  host.stderr.on('data', (chunk) => {
    log += chunk;
    writeFileSync(hostLog, log);
  });
  // Stops everything started and removes the root.
  async function stop() {
    host.kill('SIGTERM');
    await new Promise((resolve) => {
      if (host.exitCode !== null || host.signalCode !== null) resolve();
      host.once('exit', resolve).once('error', resolve);
    });
    for (const service of ['kovaperfeventd', 'kovastatd', ...(database ? ['pgsql'] : [])]) {
      try {
        kova(['service', 'stop', service]);
      } catch {
        // Not running.
      }
    }
    rmSync(root, {recursive: true, force: true});
  }
  let port;
  try {
    port = await waitFor(() => /listening on http:\/\/127\.0\.0\.1:(\d+)\//.exec(log)?.[1],
                         'kova-webapid to listen');
  } catch (error) {
    error.message += `\n${log}`;
    await stop();  // a start that fails leaves no daemon behind
    throw error;
  }
  const url = `http://127.0.0.1:${port}/`;

  return {
    root,
    url,
    kova,
    hostLog: () => log,
    daemonLog: (name) => {
      try {
        return readFileSync(join(root, `${name}.err`), 'utf8');
      } catch {
        return '';
      }
    },
    stop,
  };
}

// Signs in to the web API of `system` as a script would; returns
// call(api, method, params) that sends each value as JSON and resolves to the
// answer's data, or throws with the answer.
export async function apiSession(system) {
  const post = async (params) => {
    const reply = await fetch(`${system.url}webapi/entry.cgi`, {method: 'POST', body: new URLSearchParams(params)});
    const answer = await reply.json();
    if (answer.success !== true) throw new Error(`${params.api} ${params.method}: ${JSON.stringify(answer)}`);
    return answer.data;
  };
  const {sid} = await post({api: 'KOVA.API.Auth', version: '1', method: 'login', account: kAccount, password: kPassword});
  return (api, method, params = {}) => post({api, version: '1', method, _sid: sid,
    ...Object.fromEntries(Object.entries(params).map(([name, value]) => [name, JSON.stringify(value)]))});
}

// Starts a system (with `options`) and a browser before the tests of a file,
// and stops both after them. `started({system, browser})` runs once both are
// up, to keep them and prepare what the tests need.
export function useSystem(options, started) {
  let system;
  let browser;
  before(async () => {
    system = await startSystem(options);
    browser = await launchBrowser();
    await started({system, browser});
  });
  after(async () => {
    await browser?.close();
    await system?.stop();
  });
}

// Debian's chromium, headless, with nothing that reaches out to the network.
export async function launchBrowser() {
  return chromium.launch({
    executablePath: process.env.KOVA_CHROMIUM ?? '/usr/bin/chromium',
    args: ['--no-sandbox', '--disable-gpu', '--disable-quic', '--no-first-run',
           '--disable-background-networking', '--disable-component-update', '--disable-sync'],
  });
}

// A page of a new context that records every console error, page error and
// failed request (a missing favicon included) in `problems`.
export async function openPage(browser, url, {locale = 'en-GB', viewport = {width: 1280, height: 800}} = {}) {
  const context = await browser.newContext({locale, viewport, acceptDownloads: true});
  const page = await context.newPage();
  const problems = [];
  page.on('console', (message) => {
    if (message.type() === 'error') problems.push(`console: ${message.text()}`);
  });
  page.on('pageerror', (error) => problems.push(`page error: ${error.message}`));
  page.on('requestfailed', (request) => {
    // A download's request ends as "aborted" in the page once the file is taken.
    if (request.failure()?.errorText !== 'net::ERR_ABORTED') {
      problems.push(`request failed: ${request.url()} ${request.failure()?.errorText}`);
    }
  });
  page.on('response', (response) => {
    if (response.status() >= 400) problems.push(`HTTP ${response.status()}: ${response.url()}`);
  });
  await page.goto(url);
  return {context, page, problems};
}

// Signs in through the form and waits for the first screen.
export async function signIn(page, password = kPassword) {
  await page.getByLabel('Account').fill(kAccount);
  await page.getByLabel('Password').fill(password);
  await page.getByRole('button', {name: 'Sign in'}).click();
  await page.getByRole('navigation', {name: 'Screens'}).waitFor();
}

// Saves a full-page screenshot as <screenshots>/<name>.png.
export async function screenshot(page, name) {
  mkdirSync(screenshots, {recursive: true});
  await page.screenshot({path: join(screenshots, `${name}.png`), fullPage: true});
}
