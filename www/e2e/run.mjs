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
// Exit status: 0 when every screen rendered and the page threw nothing,
// 1 otherwise, 2 on a usage error.

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
// shows (for example parts of the host not built yet) are reported too.
async function notices(page, scope) {
  return page.$$eval(`${scope} .notice:not([hidden])`, (els) => els.map((e) => e.textContent.trim()));
}

// Waits until the visible screen has no "loading" placeholder left.
async function settled(page, scope) {
  await page.waitForFunction((sel) => !document.querySelector(`${sel} .loading`), scope, { timeout });
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
      }
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
