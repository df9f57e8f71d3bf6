// The screens against a fake host: what a user sees and what is sent.

import { afterEach, beforeEach, describe, expect, it, vi } from 'vitest';
import { ApiClient, memoryStore } from '../src/api/client';
import type { Rule } from '../src/api/portforward';
import { startApp } from '../src/app';
import type { AppContext } from '../src/context';
import { JobGuard } from '../src/jobs';
import { createCompatScreen } from '../src/screens/compat';
import { createRouterScreen } from '../src/screens/router';
import { createRulesScreen } from '../src/screens/rules';
import { createServicesScreen } from '../src/screens/services';
import { createTestScreen } from '../src/screens/test';
import { fail, fakeHost, flush, ok, type Handler } from './fakeHost';

const R = 'ZARK.Core.PortForwarding.Rules';
const B = 'ZARK.Core.PortForwarding';

const idle: Handler = () => ok({ process: 'none' });

function setup(handlers: Record<string, Handler>) {
  const host = fakeHost(handlers);
  const store = memoryStore();
  store.save({ token: 'tok', account: 'admin' });
  const client = new ApiClient({ fetch: host.fetch, store });
  const ctx: AppContext = { client, jobs: new JobGuard(), signal: new AbortController().signal };
  return { host, client, ctx };
}

const rule = (id: string, port: string): Rule => ({
  rule_id: id,
  enable: true,
  router_protocol: 'tcp',
  router_port: port,
  ds_port: port,
  serviceid: '',
  service_name: '',
});

const byText = (root: ParentNode, tag: string, text: string) =>
  [...root.querySelectorAll(tag)].find((e) => e.textContent === text) as HTMLElement | undefined;

beforeEach(() => {
  vi.useFakeTimers();
  document.body.innerHTML = '';
  window.location.hash = '';
});
afterEach(() => {
  vi.useRealTimers();
});

describe('login and session', () => {
  it('logs in and shows the router screen', async () => {
    const host = fakeHost({
      'auth login': () => ok({ token: 'T', account: 'admin' }),
      'ZARK.Core.PortForwarding.RouterConf get': () => fail(1501),
      'ZARK.Core.PortForwarding.RouterList list': () => ok({ routers: [{ router_brand: 'Acme', router_model: 'RT-1', router_version: '1', generic: true }] }),
    });
    const root = document.createElement('div');
    document.body.appendChild(root);
    startApp(root, new ApiClient({ fetch: host.fetch, store: memoryStore() }));
    expect(root.querySelector('#screen-login')).not.toBeNull();
    (root.querySelector('#login-account') as HTMLInputElement).value = 'admin';
    (root.querySelector('#login-passwd') as HTMLInputElement).value = 'pw';
    root.querySelector('form')!.dispatchEvent(new Event('submit', { cancelable: true }));
    await vi.advanceTimersByTimeAsync(0);
    expect(root.querySelector('#screen-login')).toBeNull();
    expect([...root.querySelectorAll('nav a')].map((a) => a.textContent)).toEqual(['Router', 'Rules', 'Services', 'Test', 'Compatibility']);
    expect((root.querySelector('#screen-router') as HTMLElement).hidden).toBe(false);
    expect((root.querySelector('#screen-rules') as HTMLElement).hidden).toBe(true);
    expect(root.querySelector('.conf-view')!.textContent).toMatch(/No router is configured/);
    expect(root.querySelector('.router-list td')!.textContent).toBe('Acme');
    expect(host.calls.filter((c) => c.url.endsWith('entry.cgi')).every((c) => c.headers['X-ZARK-Token'] === 'T')).toBe(true);
  });

  it('counts down after a slowed-down login', async () => {
    const host = fakeHost({ 'auth login': () => fail(105, { retry_after: 3 }) });
    const root = document.createElement('div');
    startApp(root, new ApiClient({ fetch: host.fetch, store: memoryStore() }));
    (root.querySelector('#login-account') as HTMLInputElement).value = 'admin';
    root.querySelector('form')!.dispatchEvent(new Event('submit', { cancelable: true }));
    await vi.advanceTimersByTimeAsync(0);
    const button = root.querySelector('button[type=submit]') as HTMLButtonElement;
    expect(root.querySelector('.notice-error')!.textContent).toMatch(/Wait 3 seconds/);
    expect(button.disabled).toBe(true);
    expect(button.textContent).toBe('Log in (wait 3 s)');
    await vi.advanceTimersByTimeAsync(3000);
    expect(button.disabled).toBe(false);
    expect(button.textContent).toBe('Log in');
  });

  it('goes back to the login screen when the session has ended', async () => {
    const { client } = setup({
      'ZARK.Core.PortForwarding.RouterConf get': () => fail(106),
      'ZARK.Core.PortForwarding.RouterList list': () => fail(106),
    });
    const root = document.createElement('div');
    startApp(root, client);
    expect(root.querySelector('nav')).not.toBeNull();
    await vi.advanceTimersByTimeAsync(0);
    expect(root.querySelector('#screen-login')).not.toBeNull();
    expect(root.querySelector('.notice-error')!.textContent).toMatch(/Your session has ended\. Log in again\./);
    expect(client.loggedIn).toBe(false);
  });
});

describe('rules screen', () => {
  it('checks the port syntax before anything is sent', async () => {
    const { host, ctx } = setup({
      [`${R} load`]: () => ok([rule('0', '80')]),
      'ZARK.Core.PortForwarding.RouterList get': () => ok({ support_change_port: true }),
    });
    const s = createRulesScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    byText(s.el, 'button', 'Add rule')!.click();
    (s.el.querySelector('#rf-router-port') as HTMLInputElement).value = '8080-80';
    s.el.querySelector('.rule-form')!.dispatchEvent(new Event('submit', { cancelable: true }));
    expect(s.el.querySelector('.rule-form .field-error')!.textContent).toBe('Router port: The range 8080-80 ends below its start.');
    expect(s.el.querySelector('[data-field=routerPort]')!.classList.contains('invalid')).toBe(true);
    expect(s.el.querySelectorAll('tbody tr')).toHaveLength(1);
    expect(host.callsTo(R, 'save')).toHaveLength(0);
  });

  it('adds a rule, saves with progress through "del" and "add", and reloads', async () => {
    let saved: Rule[] = [rule('0', '80')];
    let polls = 0;
    const seen: string[] = [];
    const { host, ctx } = setup({
      [`${R} load`]: () => ok(saved),
      'ZARK.Core.PortForwarding.RouterList get': () => ok({ support_change_port: true }),
      [`${B} get_current_process`]: idle,
      [`${R} save`]: (p) => {
        saved = p.rules as Rule[];
        return ok({ task_id: 'ZARK.Core.PortForwarding.save_rules1' });
      },
      [`${R} save_status`]: () => {
        polls++;
        if (polls === 1) return ok({ status: 'processing', percentage: 25, stage: 'del' });
        if (polls === 2) return ok({ status: 'processing', percentage: 75, stage: 'add' });
        return ok({ status: 'success', percentage: 100 });
      },
    });
    const s = createRulesScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    byText(s.el, 'button', 'Add rule')!.click();
    (s.el.querySelector('#rf-protocol') as HTMLSelectElement).value = 'udp';
    (s.el.querySelector('#rf-router-port') as HTMLInputElement).value = '5000-5002, 6000';
    s.el.querySelector('.rule-form')!.dispatchEvent(new Event('submit', { cancelable: true }));
    expect(s.el.querySelectorAll('tbody tr')).toHaveLength(2);
    expect(s.el.querySelector('.dirty')!.textContent).toMatch(/Unsaved changes/);

    byText(s.el, 'button', 'Save and apply')!.click();
    const text = () => s.el.querySelector('.progress-text')!.textContent!;
    await vi.advanceTimersByTimeAsync(0);
    expect(byText(s.el, 'button', 'Save and apply')!.hasAttribute('disabled')).toBe(true);
    await vi.advanceTimersByTimeAsync(500);
    seen.push(text());
    await vi.advanceTimersByTimeAsync(500);
    seen.push(text());
    await vi.advanceTimersByTimeAsync(500);
    seen.push(text());
    expect(seen).toEqual([
      'Removing the old mappings from the router (25%)',
      'Adding the new mappings to the router (75%)',
      'Saved and applied on the router (100%)',
    ]);
    expect(host.callsTo(R, 'save')[0]!.params.rules).toEqual([
      rule('0', '80'),
      { rule_id: '1', serviceid: '', service_name: '', enable: true, router_protocol: 'udp', router_port: '5000-5002,6000', ds_port: '5000-5002,6000' },
    ]);
    expect(host.callsTo(R, 'save_status').map((c) => c.params.task_id)).toEqual(Array(3).fill('ZARK.Core.PortForwarding.save_rules1'));
    expect(host.callsTo(R, 'load')).toHaveLength(2);
    expect(s.el.querySelector('.notice-success')!.textContent).toMatch(/saved and applied/);
    expect(s.el.querySelector('.dirty')!.textContent).toBe('');
  });

  it('explains a refused save with the router’s limit', async () => {
    const { ctx } = setup({
      [`${R} load`]: () => ok([rule('0', '80')]),
      'ZARK.Core.PortForwarding.RouterList get': () => fail(1501),
      [`${B} get_current_process`]: idle,
      [`${R} save`]: () => ok({ task_id: 's' }),
      [`${R} save_status`]: () => fail(1521, { sec: '', key: '', append: { max_port: 32767 } }),
    });
    const s = createRulesScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    byText(s.el, 'button', 'Save and apply')!.click();
    await vi.advanceTimersByTimeAsync(600);
    const err = s.el.querySelector('.notice-error')!;
    expect(err.textContent).toBe(
      'A port is above the highest port the router accepts (32767). Use ports up to 32767. (code 1521)',
    );
    expect(err.getAttribute('role')).toBe('alert');
    expect((s.el.querySelector('.progress') as HTMLElement).hidden).toBe(true);
    expect(byText(s.el, 'button', 'Save and apply')!.hasAttribute('disabled')).toBe(false);
  });

  it('refuses to save while the server runs another job', async () => {
    const { host, ctx } = setup({
      [`${R} load`]: () => ok([]),
      'ZARK.Core.PortForwarding.RouterList get': () => ok({ support_change_port: false }),
      [`${B} get_current_process`]: () => ok({ process: 'autotest' }),
    });
    const s = createRulesScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    expect(s.el.textContent).toMatch(/forwards each port to the same local port only/);
    byText(s.el, 'button', 'Save and apply')!.click();
    await vi.advanceTimersByTimeAsync(0);
    expect(s.el.querySelector('.notice-error')!.textContent).toMatch(/busy with a router compatibility test/);
    expect(host.callsTo(R, 'save')).toHaveLength(0);
  });
});

describe('router screen', () => {
  it('follows a detection run step by step', async () => {
    const stages = [
      { status: 'processing', percentage: 30, progress: { check_interface_enable_step: { status: 'success', check_id: 1, network_interface: 'eth0' }, check_gateway_setting_step: { status: 'processing', check_id: 2 } } },
      {
        status: 'success',
        percentage: 100,
        support_upnp: 'yes',
        support_natpmp: 'no',
        router_brand: 'Acme',
        router_model: 'RT-1',
        router_version: '3',
        progress: Object.fromEntries(
          ['check_interface_enable_step', 'check_gateway_setting_step', 'check_connect_wan_step', 'check_hops_lan2wan_step', 'check_dns_setting_step', 'detect_router_step'].map((n) => [n, { status: 'success' }]),
        ),
      },
    ];
    let i = 0;
    const { host, ctx } = setup({
      'ZARK.Core.PortForwarding.RouterConf get': () => fail(1501),
      'ZARK.Core.PortForwarding.RouterList list': () => ok({ routers: [] }),
      [`${B} get_current_process`]: idle,
      [`${B} detect`]: () => ok({ task_id: 'ZARK.Core.PortForwarding.detect1' }),
      [`${B} detect_status`]: () => ok(stages[Math.min(i++, 1)]),
    });
    const s = createRouterScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    byText(s.el, 'button', 'Detect router')!.click();
    await vi.advanceTimersByTimeAsync(500);
    const statuses = () => [...s.el.querySelectorAll('.checklist li')].map((li) => (li as HTMLElement).dataset.status);
    expect(statuses()).toEqual(['success', 'processing', 'initial', 'initial', 'initial', 'initial']);
    expect(s.el.querySelector('.progress-text')!.textContent).toBe('Step 2 of 6: Default gateway is set (17%)');
    await vi.advanceTimersByTimeAsync(500);
    expect(statuses()).toEqual(Array(6).fill('success'));
    expect(s.el.querySelector('.router-found')!.textContent).toMatch(/Acme/);
    expect(host.callsTo(B, 'detect_status')).toHaveLength(2);

    byText(s.el, 'button', 'Use the detected router below')!.click();
    expect((s.el.querySelector('#rc-brand') as HTMLInputElement).value).toBe('Acme');
    expect((s.el.querySelector('#rc-mode-upnp') as HTMLInputElement).checked).toBe(true);
  });

  it('saves a pages configuration and never shows the password back', async () => {
    const { host, ctx } = setup({
      'ZARK.Core.PortForwarding.RouterConf get': () =>
        ok({ router_brand: 'Acme', router_model: 'RT-1', router_version: '3', support_upnp: 'no', support_natpmp: 'no', router_port: '8080', router_protocol: 'http', router_max_rule: '32' }),
      'ZARK.Core.PortForwarding.RouterConf set': () => ok(null),
      'ZARK.Core.PortForwarding.RouterList list': () => ok({ routers: [] }),
    });
    const s = createRouterScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    expect((s.el.querySelector('#rc-mode-pages') as HTMLInputElement).checked).toBe(true);
    expect((s.el.querySelector('#rc-port') as HTMLInputElement).value).toBe('8080');
    expect((s.el.querySelector('#rc-password') as HTMLInputElement).value).toBe('');
    (s.el.querySelector('#rc-account') as HTMLInputElement).value = 'root';
    (s.el.querySelector('#rc-password') as HTMLInputElement).value = 's3cret';
    s.el.querySelector('.router-conf-form')!.dispatchEvent(new Event('submit', { cancelable: true }));
    await vi.advanceTimersByTimeAsync(0);
    expect(host.callsTo('ZARK.Core.PortForwarding.RouterConf', 'set')[0]!.params).toEqual({
      router_brand: 'Acme',
      router_model: 'RT-1',
      router_version: '3',
      support_upnp: 'no',
      support_natpmp: 'no',
      router_protocol: 'http',
      router_port: 8080,
      router_account: 'root',
      router_pass: 's3cret',
    });
    expect((s.el.querySelector('#rc-password') as HTMLInputElement).value).toBe('');
    expect(s.el.textContent).not.toContain('s3cret');
    expect(s.el.querySelector('.notice-success')!.textContent).toMatch(/saved/);
  });
});

describe('compatibility screen', () => {
  it('stops a running test', async () => {
    const { host, ctx } = setup({
      [`${B} get_current_process`]: idle,
      'ZARK.Core.PortForwarding.Compatibility test': () => ok({ task_id: 'ZARK.Core.PortForwarding.test_compatibility1' }),
      'ZARK.Core.PortForwarding.Compatibility test_status': () =>
        ok({ status: 'processing', percentage: 18, test: [{ test_item: 'add', status: 'success' }, { test_item: 'max', status: 'processing' }] }),
      'ZARK.Core.PortForwarding.Compatibility stop': () => ok(null),
    });
    const s = createCompatScreen(ctx);
    byText(s.el, 'button', 'Start test')!.click();
    await vi.advanceTimersByTimeAsync(1000);
    expect(s.el.querySelector('.progress-text')!.textContent).toBe('Testing (18%)');
    const stop = byText(s.el, 'button', 'Stop test') as HTMLButtonElement;
    expect(stop.disabled).toBe(false);
    stop.click();
    await vi.advanceTimersByTimeAsync(0);
    await flush();
    expect(s.el.querySelector('.notice-info')!.textContent).toBe('The test was stopped.');
    const polled = host.callsTo('ZARK.Core.PortForwarding.Compatibility', 'test_status').length;
    await vi.advanceTimersByTimeAsync(5000);
    expect(host.callsTo('ZARK.Core.PortForwarding.Compatibility', 'test_status')).toHaveLength(polled);
    expect(ctx.jobs.running).toBeNull();
  });

  it('offers the upload after a failed test', async () => {
    const { host, ctx } = setup({
      [`${B} get_current_process`]: idle,
      'ZARK.Core.PortForwarding.Compatibility test': () => ok({ task_id: 'c' }),
      'ZARK.Core.PortForwarding.Compatibility test_status': () =>
        ok({ status: 'failed', percentage: -1, test: [{ test_item: 'add', status: 'failed' }] }),
      'ZARK.Core.PortForwarding.Compatibility upload': () => ok(null),
    });
    const s = createCompatScreen(ctx);
    byText(s.el, 'button', 'Start test')!.click();
    await vi.advanceTimersByTimeAsync(1000);
    expect(s.el.querySelector('.notice-warning')!.textContent).toMatch(/failed the UPnP compatibility test/);
    const upload = byText(s.el, 'button', 'Upload the failed result') as HTMLButtonElement;
    expect(upload.disabled).toBe(false);
    upload.click();
    await vi.advanceTimersByTimeAsync(0);
    expect(host.callsTo('ZARK.Core.PortForwarding.Compatibility', 'upload')).toHaveLength(1);
    expect(s.el.querySelector('.notice-success')!.textContent).toBe('The failed result was uploaded.');
  });
});

describe('test screen', () => {
  it('shows each rule’s result as it comes', async () => {
    const answers = [
      { status: 'wait' },
      { status: 'update', rules: { '0': 'testing', '1': 'testing' } },
      { status: 'update', rules: { '0': 'ok', '1': 'testing' } },
      { status: 'success', rules: { '0': 'ok', '1': 'connection refused' } },
    ];
    let i = 0;
    const { host, ctx } = setup({
      [`${B} get_current_process`]: idle,
      [`${R} load`]: () => ok([rule('0', '80'), rule('1', '443')]),
      [`${R} test`]: () => ok({ task_id: 'ZARK.Core.PortForwarding.test_rules1' }),
      [`${R} test_status`]: () => ok(answers[Math.min(i++, 3)]),
    });
    const s = createTestScreen(ctx);
    byText(s.el, 'button', 'Start test')!.click();
    const results = () => [...s.el.querySelectorAll('td.result')].map((td) => td.textContent);
    const line = () => s.el.querySelector('.progress-text')!.textContent;
    await vi.advanceTimersByTimeAsync(500);
    expect(line()).toBe('Preparing the test');
    await vi.advanceTimersByTimeAsync(500);
    expect(results()).toEqual(['Testing…', 'Testing…']);
    await vi.advanceTimersByTimeAsync(500);
    expect(results()).toEqual(['ok', 'Testing…']);
    expect(line()).toBe('Testing: 1 of 2 (50%)');
    await vi.advanceTimersByTimeAsync(500);
    expect(results()).toEqual(['ok', 'connection refused']);
    expect(s.el.querySelector('.notice-success')!.textContent).toBe('The test finished with 2 results.');
    expect(host.callsTo(R, 'test')[0]!.params).toEqual({});
    await vi.advanceTimersByTimeAsync(5000);
    expect(host.callsTo(R, 'test_status')).toHaveLength(4);
  });

  it('tests chosen services', async () => {
    const { host, ctx } = setup({
      [`${B} get_current_process`]: idle,
      'ZARK.Core.PortForwarding.Rules.Serv check': () =>
        ok({ service_status: [{ service_id: 'ftp', status: 'deny' }, { service_id: 'web', status: 'allow' }] }),
      'ZARK.Core.PortForwarding.Rules.Serv test': () => ok({ task_id: 'ZARK.Core.PortForwarding.test_serv1' }),
      'ZARK.Core.PortForwarding.Rules.Serv test_status': () => ok({ status: 'success', rules: { 'web.tcp': 'ok' } }),
    });
    const s = createTestScreen(ctx);
    const servMode = s.el.querySelector('#test-mode-services') as HTMLInputElement;
    servMode.checked = true;
    servMode.dispatchEvent(new Event('change'));
    await vi.advanceTimersByTimeAsync(0);
    byText(s.el, 'button', 'Start test')!.click();
    expect(s.el.querySelector('.notice-warning')!.textContent).toBe('Choose at least one service to test.');
    const web = s.el.querySelector('input[value=web]') as HTMLInputElement;
    web.checked = true;
    web.dispatchEvent(new Event('change'));
    byText(s.el, 'button', 'Start test')!.click();
    await vi.advanceTimersByTimeAsync(500);
    expect(host.callsTo('ZARK.Core.PortForwarding.Rules.Serv', 'test')[0]!.params).toEqual({ service_id: ['web'] });
    expect([...s.el.querySelectorAll('.test-results tbody tr')].map((r) => r.textContent)).toEqual(['web.tcpok']);
  });
});

describe('services screen', () => {
  it('opens a service’s ports with a service policy and checks again', async () => {
    let forwarded = false;
    const { host, ctx } = setup({
      [`${B} get_current_process`]: idle,
      'ZARK.Core.PortForwarding.Rules.Serv check': () =>
        ok({ service_status: [{ service_id: 'ftp', status: forwarded ? 'allow' : 'deny', port_info: { ftp: forwarded ? 'allow' : 'deny' } }] }),
      [`${R} save`]: () => ok({ task_id: 'ZARK.Core.PortForwarding.save_rules' }),
      [`${R} save_status`]: () => {
        forwarded = true;
        return ok({ status: 'success', percentage: 100 });
      },
    });
    const s = createServicesScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    expect(s.el.querySelector('.svc-status')!.textContent).toBe('Not forwarded');
    byText(s.el, 'button', 'Open ports')!.click();
    await vi.advanceTimersByTimeAsync(500);
    expect(host.callsTo(R, 'save')[0]!.params).toEqual({ pf_policy: { add: ['ftp'] } });
    expect(s.el.querySelector('.svc-status')!.textContent).toBe('Forwarded');
    expect(s.el.querySelector('.notice-success')!.textContent).toMatch(/Opening the ports of ftp: done/);
  });

  it('explains a policy that could not be written', async () => {
    const { ctx } = setup({
      [`${B} get_current_process`]: idle,
      'ZARK.Core.PortForwarding.Rules.Serv check': () => ok({ service_status: [{ service_id: 'ftp', status: 'allow' }] }),
      [`${R} save`]: () => ok({ task_id: 's' }),
      [`${R} save_status`]: () => fail(1527, { sec: '', key: '', append: null }),
    });
    const s = createServicesScreen(ctx);
    s.enter();
    await vi.advanceTimersByTimeAsync(0);
    byText(s.el, 'button', 'Close ports')!.click();
    await vi.advanceTimersByTimeAsync(500);
    expect(s.el.querySelector('.notice-error')!.textContent).toMatch(/rules for the services could not be written.*\(code 1527\)/);
  });
});
