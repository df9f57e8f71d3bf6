// End-to-end check of the built front end in a real browser.
//
// Starts nothing itself: it drives Debian's Chromium (headless) against a
// running host, logs in, visits every screen and saves a screenshot of each
// into the artifacts folder, with summary.json listing what each screen
// showed in its message areas.
//
// Environment:
//   ZARK_E2E_URL         base URL of the host, e.g. http://127.0.0.1:8080/ (required)
//   ZARK_E2E_ACCOUNT     account to log in with (required unless login-only)
//   ZARK_E2E_PASSWORD    its password (may be empty)
//   ZARK_E2E_LOGIN_ONLY  "1": only check that the login page renders
//   ZARK_E2E_DETECT      "1": also run a router detection (it changes
//                        nothing on the router) and capture its checklist
//   ZARK_E2E_ARTIFACTS   folder for screenshots (default ./e2e-artifacts)
//   ZARK_E2E_CHROMIUM    browser binary (default /usr/bin/chromium)
//   ZARK_E2E_TIMEOUT_MS  wait for one page state (default 15000)
//
// Steps that change the router (each off unless its variable is set; for
// a host in a test network, see tests/e2e/run-e2e.sh):
//   ZARK_E2E_DETECT_REQUIRE  "1": the detection must find a router
//   ZARK_E2E_ROUTER      "BRAND/MODEL": choose this router from the known
//                        routers, talk to it by ZARK_E2E_ROUTER_MODE ("upnp",
//                        the default, or "natpmp"), save the configuration
//   ZARK_E2E_RULES       "1": add three rules (TCP 18080->8080, UDP
//                        15000->5000, TCP 20000-20009), save them and follow
//                        the progress bar to its end
//   ZARK_E2E_MAPPINGS_CMD  shell command that prints the router's mappings
//                        as "upnpc -l" does; after each save the expected
//                        mappings must be listed there
//   ZARK_E2E_SERVICE     a service id: open its ports on the Services screen
//   ZARK_E2E_SERVICE_MAPPINGS  the mappings that opening it adds, as
//                        "PROTO EXTERNAL INTERNAL" items separated by ","
//                        (e.g. "TCP 22 22")
//   ZARK_E2E_REACHABILITY  "1": test the saved rules from outside; every
//                        enabled rule must come out "reachable"
//
// Exit status: 0 when every screen rendered and the page threw nothing,
// 1 otherwise, 2 on a usage error.

import { execFile } from 'node:child_process';
import { mkdir, mkdtemp, rm, writeFile } from 'node:fs/promises';
import { tmpdir } from 'node:os';
import { join, resolve } from 'node:path';
import { chromium } from 'playwright-core';

const env = process.env;
const baseUrl = env.ZARK_E2E_URL;
const loginOnly = env.ZARK_E2E_LOGIN_ONLY === '1';
const account = env.ZARK_E2E_ACCOUNT;
const password = env.ZARK_E2E_PASSWORD ?? '';
const artifacts = resolve(env.ZARK_E2E_ARTIFACTS ?? 'e2e-artifacts');
const executablePath = env.ZARK_E2E_CHROMIUM ?? '/usr/bin/chromium';
const timeout = Number(env.ZARK_E2E_TIMEOUT_MS ?? 15000);
const runDetect = env.ZARK_E2E_DETECT === '1';
// The page follows a detection for at most 3 minutes.
const DETECT_TIMEOUT_MS = 200_000;
const requireRouter = env.ZARK_E2E_DETECT_REQUIRE === '1';
const pickRouter = env.ZARK_E2E_ROUTER ?? '';
const routerMode = env.ZARK_E2E_ROUTER_MODE || 'upnp';
const runRules = env.ZARK_E2E_RULES === '1';
const mappingsCmd = env.ZARK_E2E_MAPPINGS_CMD ?? '';
const serviceToOpen = env.ZARK_E2E_SERVICE ?? '';
const serviceMappings = env.ZARK_E2E_SERVICE_MAPPINGS ?? '';
const runReachability = env.ZARK_E2E_REACHABILITY === '1';
// A save or a service change on the router: the page polls for 10 minutes
// at most; a test network's router answers within seconds.
const SAVE_TIMEOUT_MS = 180_000;
// The reachability test: the page polls for 10 minutes at most.
const REACHABILITY_TIMEOUT_MS = 300_000;
const MAPPINGS_CMD_TIMEOUT_MS = 30_000;

// The three rules of ZARK_E2E_RULES, and the mappings they make.
const RULES = [
  { protocol: 'tcp', routerPort: '18080', localPort: '8080' },
  { protocol: 'udp', routerPort: '15000', localPort: '5000' },
  { protocol: 'tcp', routerPort: '20000-20009', localPort: '20000-20009' },
];
const RULE_MAPPINGS = [
  'TCP 18080 8080',
  'UDP 15000 5000',
  ...Array.from({ length: 10 }, (_, i) => `TCP ${20000 + i} ${20000 + i}`),
];

if (!baseUrl || (!loginOnly && !account)) {
  console.error('usage: ZARK_E2E_URL=http://host:port/ ZARK_E2E_ACCOUNT=name ZARK_E2E_PASSWORD=... node e2e/run.mjs');
  console.error('       ZARK_E2E_URL=... ZARK_E2E_LOGIN_ONLY=1 node e2e/run.mjs');
  process.exit(2);
}

const SCREENS = [
  { id: 'router', link: 'Router' },
  { id: 'rules', link: 'Rules' },
  { id: 'services', link: 'Services' },
  { id: 'test', link: 'Test' },
  { id: 'compat', link: 'Compatibility' },
];

const BROWSER_FLAGS = [
  '--headless',
  '--no-sandbox',
  '--disable-gpu',
  '--disable-quic',
  '--no-first-run',
  '--disable-background-networking',
  '--disable-component-update',
  '--disable-sync',
];

const summary = { url: baseUrl, loginOnly, steps: [], pageErrors: [], consoleErrors: [], ok: false };

function step(name, detail = {}) {
  summary.steps.push({ name, ...detail });
  console.log(`e2e: ${name}${detail.notices?.length ? ` — ${detail.notices.join(' | ')}` : ''}`);
}

// Texts of the visible message areas of a screen, so that failures the page
// shows (an error answer of the host, for example) are reported too.
async function notices(page, scope) {
  return page.$$eval(`${scope} .notice:not([hidden])`, (els) => els.map((e) => e.textContent.trim()));
}

// Waits until the visible screen has no "loading" placeholder left.
async function settled(page, scope) {
  await page.waitForFunction((sel) => !document.querySelector(`${sel} .loading`), scope, { timeout });
}

// Runs ZARK_E2E_MAPPINGS_CMD and returns the mappings it lists as
// "PROTO EXTERNAL INTERNAL" texts. upnpc -l prints one line a mapping:
//    0 TCP 18080->192.168.77.2:8080  'zark' '' 0
async function routerMappings() {
  const out = await new Promise((resolveOut, reject) => {
    execFile('sh', ['-c', mappingsCmd], { timeout: MAPPINGS_CMD_TIMEOUT_MS }, (err, stdout, stderr) => {
      if (err) reject(new Error(`${mappingsCmd}: ${err.message} ${stderr}`));
      else resolveOut(stdout);
    });
  });
  const found = new Set();
  for (const m of out.matchAll(/\b(TCP|UDP)\s+(\d+)->[\d.]+:(\d+)/g)) found.add(`${m[1]} ${m[2]} ${m[3]}`);
  return { found, raw: out };
}

// Fails unless the router lists every mapping of wanted.
async function checkMappings(name, wanted) {
  if (!mappingsCmd) return;
  const { found, raw } = await routerMappings();
  const missing = wanted.filter((w) => !found.has(w));
  step(name, { mappings: [...found].sort(), missing });
  if (missing.length > 0) throw new Error(`${name}: the router lacks ${missing.join(', ')}; it lists:\n${raw}`);
}

// Follows a progress bar until one of the done selectors appears; returns
// the distinct "value text" states seen and which selector ended it.
async function followProgress(page, scope, doneSelectors, timeoutMs) {
  const seen = [];
  const deadline = Date.now() + timeoutMs;
  while (Date.now() < deadline) {
    const state = await page.$eval(`${scope} .progress`, (el) => ({
      hidden: el.hidden,
      value: el.querySelector('progress')?.getAttribute('value') ?? null,
      text: el.querySelector('.progress-text')?.textContent ?? '',
    }));
    const line = state.hidden ? 'hidden' : `${state.value ?? '?'} ${state.text}`;
    if (seen[seen.length - 1] !== line) seen.push(line);
    for (const sel of doneSelectors) {
      if (await page.$(sel)) return { seen, done: sel, state };
    }
    await page.waitForTimeout(100);
  }
  throw new Error(`${scope}: no end within ${timeoutMs} ms; progress seen: ${seen.join(' | ')}`);
}

// Chooses BRAND/MODEL from the known routers, sets the protocol and saves.
async function storeRouter(page, scope) {
  const [brand, model] = pickRouter.split('/');
  const row = page.locator(`${scope} table.routers tbody tr`, {
    has: page.locator(`td:text-is("${brand}")`),
  }).filter({ has: page.locator(`td:has-text("${model}")`) });
  await row.first().locator('button:text-is("Choose")').click();
  await page.check(`#rc-mode-${routerMode}`);
  await page.click(`${scope} .router-conf-form button[type=submit]`);
  const outcome = await Promise.race([
    page.waitForSelector(`${scope} .notice-success:has-text("router configuration was saved")`).then(() => 'saved'),
    page.waitForSelector(`${scope} .notice-error`).then(() => 'error'),
  ]);
  await settled(page, scope);
  const shot = 'router-stored.png';
  await page.screenshot({ path: join(artifacts, shot), fullPage: true });
  const conf = await page.$$eval(`${scope} dl.conf .kv`, (els) => els.map((e) => e.textContent.trim()));
  step('router stored', { screenshot: shot, mode: routerMode, conf, notices: await notices(page, scope) });
  if (outcome !== 'saved') throw new Error(`storing the router failed: ${(await notices(page, scope)).join(' | ')}`);
}

// Adds the three rules and saves them, following the progress bar.
async function saveThreeRules(page, scope) {
  for (const r of RULES) {
    await page.click(`${scope} button:text-is("Add rule")`);
    await page.selectOption('#rf-protocol', r.protocol);
    await page.fill('#rf-router-port', r.routerPort);
    await page.fill('#rf-local-port', r.localPort);
    await page.click(`${scope} .rule-form button[type=submit]`);
    await page.waitForSelector(`${scope} .rule-form`, { state: 'detached' });
  }
  const rows = await page.$$eval(`${scope} table.rules tbody tr.rule`, (els) =>
    els.map((e) => [...e.querySelectorAll('td')].slice(1, 4).map((td) => td.textContent.trim()).join(' ')),
  );
  let shot = 'rules-added.png';
  await page.screenshot({ path: join(artifacts, shot), fullPage: true });
  step('three rules added', { screenshot: shot, rows });

  await page.click(`${scope} button:text-is("Save and apply")`);
  const { seen, done, state } = await followProgress(
    page,
    scope,
    [`${scope} .notice-success`, `${scope} .notice-error`],
    SAVE_TIMEOUT_MS,
  );
  shot = 'rules-saved.png';
  await page.screenshot({ path: join(artifacts, shot), fullPage: true });
  step('rules saved', { screenshot: shot, progress: seen, notices: await notices(page, scope) });
  if (done.endsWith('.notice-error')) throw new Error(`saving the rules failed: ${(await notices(page, scope)).join(' | ')}`);
  if (state.hidden || state.value !== '100') throw new Error(`the progress bar ended at ${state.value}: ${state.text}`);
  await checkMappings('rules on the router', RULE_MAPPINGS);
}

// Opens the ports of one service and checks that it counts as forwarded.
async function openService(page, scope) {
  const row = `${scope} tr[data-service-id="${serviceToOpen}"]`;
  await page.waitForSelector(row);
  await page.click(`${row} button:text-is("Open ports")`);
  const { seen, done } = await followProgress(
    page,
    scope,
    [`${scope} .notice-success`, `${scope} .notice-error`],
    SAVE_TIMEOUT_MS,
  );
  await settled(page, scope);
  const shot = 'service-opened.png';
  await page.screenshot({ path: join(artifacts, shot), fullPage: true });
  const status = await page.$eval(row, (e) => e.dataset.status).catch(() => 'missing');
  step(`ports of ${serviceToOpen} opened`, { screenshot: shot, progress: seen, status, notices: await notices(page, scope) });
  if (done.endsWith('.notice-error')) throw new Error(`opening ${serviceToOpen} failed: ${(await notices(page, scope)).join(' | ')}`);
  if (status !== 'allow') throw new Error(`${serviceToOpen} is "${status}" after opening its ports, not "allow"`);
  const wanted = serviceMappings.split(',').map((m) => m.trim().replace(/\s+/g, ' ')).filter((m) => m !== '');
  await checkMappings(`${serviceToOpen} on the router`, runRules ? [...RULE_MAPPINGS, ...wanted] : wanted);
}

// Tests the saved rules from outside; every enabled rule must be reachable.
async function testReachability(page, scope) {
  const button = `${scope} button:text-is("Start test")`;
  await page.check('#test-mode-rules');
  await page.click(button);
  await page.waitForSelector(`${button}[disabled]`).catch(() => {});
  await page.waitForSelector(`${button}:not([disabled])`, { timeout: REACHABILITY_TIMEOUT_MS });
  const shot = 'reachability.png';
  await page.screenshot({ path: join(artifacts, shot), fullPage: true });
  const results = await page.$$eval(`${scope} .results-box table.rules tbody tr.rule`, (els) =>
    els.map((e) => ({
      rule: [...e.querySelectorAll('td')].slice(1, 3).map((td) => td.textContent.trim()).join(' '),
      result: e.querySelector('td.result')?.textContent.trim() ?? '',
    })),
  );
  const errors = await page.$$eval(`${scope} .notice-error`, (els) => els.filter((e) => !e.hidden).map((e) => e.textContent.trim()));
  step('reachability test', { screenshot: shot, results, notices: await notices(page, scope) });
  if (errors.length > 0) throw new Error(`the reachability test failed: ${errors.join(' | ')}`);
  if (results.length === 0) throw new Error('the reachability test listed no rule');
  const bad = results.filter((r) => r.result !== 'reachable');
  if (bad.length > 0) throw new Error(`not reachable: ${bad.map((r) => `${r.rule}: ${r.result}`).join('; ')}`);
}

const userDataDir = await mkdtemp(join(tmpdir(), 'zark-e2e-profile-'));
await mkdir(artifacts, { recursive: true });
let context;
let failed = false;
try {
  context = await chromium.launchPersistentContext(userDataDir, {
    executablePath,
    headless: true,
    args: BROWSER_FLAGS,
    viewport: { width: 1280, height: 900 },
    timeout,
  });
  const page = context.pages()[0] ?? (await context.newPage());
  page.setDefaultTimeout(timeout);
  page.on('pageerror', (e) => summary.pageErrors.push(String(e)));
  page.on('console', (m) => {
    if (m.type() === 'error') summary.consoleErrors.push(m.text());
  });

  await page.goto(baseUrl, { waitUntil: 'load' });
  await page.waitForSelector('#screen-login form');
  await page.screenshot({ path: join(artifacts, '01-login.png'), fullPage: true });
  step('login page rendered');

  if (!loginOnly) {
    await page.fill('#login-account', account);
    await page.fill('#login-passwd', password);
    await page.click('#screen-login button[type=submit]');
    const outcome = await Promise.race([
      page.waitForSelector('nav a', { timeout }).then(() => 'in'),
      page.waitForSelector('#screen-login .notice-error', { timeout }).then(() => 'refused'),
    ]);
    if (outcome !== 'in') {
      await page.screenshot({ path: join(artifacts, '02-login-refused.png'), fullPage: true });
      throw new Error(`login refused: ${(await notices(page, '#screen-login')).join(' | ')}`);
    }
    step('logged in');

    let n = 2;
    for (const s of SCREENS) {
      await page.click(`nav a[data-screen="${s.id}"]`);
      const scope = `#screen-${s.id}`;
      await page.waitForSelector(`${scope}:not([hidden]) h2`);
      await settled(page, scope);
      const file = `${String(n++).padStart(2, '0')}-${s.id}.png`;
      await page.screenshot({ path: join(artifacts, file), fullPage: true });
      step(`screen ${s.link}`, { screenshot: file, notices: await notices(page, scope) });

      if (s.id === 'router' && runDetect) {
        const button = `${scope} button.primary:text-is("Detect router")`;
        await page.click(button);
        await page.waitForSelector(`${button}[disabled]`).catch(() => {});
        await page.waitForSelector(`${button}:not([disabled])`, { timeout: DETECT_TIMEOUT_MS });
        const shot = `${String(n++).padStart(2, '0')}-router-detection.png`;
        await page.screenshot({ path: join(artifacts, shot), fullPage: true });
        const checklist = await page.$$eval(`${scope} .checklist li`, (els) =>
          els.map((e) => `${e.dataset.step}=${e.dataset.status}`),
        );
        step('router detection', { screenshot: shot, checklist, notices: await notices(page, scope) });
        if (requireRouter && !(await page.isVisible(`${scope} button:text-is("Use the detected router below")`))) {
          throw new Error(`the detection found no router: ${checklist.join(' ')}`);
        }
      }
      if (s.id === 'router' && pickRouter) await storeRouter(page, scope);
      if (s.id === 'rules' && runRules) await saveThreeRules(page, scope);
      if (s.id === 'services' && serviceToOpen) await openService(page, scope);
      if (s.id === 'test' && runReachability) await testReachability(page, scope);
    }

    await page.click('header button.link');
    await page.waitForSelector('#screen-login form');
    await page.screenshot({ path: join(artifacts, `${String(n).padStart(2, '0')}-logged-out.png`), fullPage: true });
    step('logged out');
  }

  if (summary.pageErrors.length > 0) throw new Error(`the page threw: ${summary.pageErrors.join(' | ')}`);
  summary.ok = true;
} catch (e) {
  failed = true;
  summary.error = String(e?.message ?? e);
  console.error(`e2e: FAILED: ${summary.error}`);
} finally {
  await context?.close().catch(() => {});
  await rm(userDataDir, { recursive: true, force: true });
  await writeFile(join(artifacts, 'summary.json'), JSON.stringify(summary, null, 2) + '\n');
}
console.log(`e2e: ${failed ? 'failed' : 'passed'}; screenshots in ${artifacts}`);
process.exit(failed ? 1 : 0);
