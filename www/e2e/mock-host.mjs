// A stand-in web API host for trying the front end without the real one:
// serves www/dist at "/" and answers /webapi/auth.cgi and /webapi/entry.cgi
// with the same wire protocol, from an in-memory router that simulates the
// long jobs (detection, saving, tests, compatibility test) over a few
// seconds. For development and for running e2e/run.mjs; never for
// production. Listens on 127.0.0.1 only.
//
//   node e2e/mock-host.mjs            (PORT=8137, account admin / admin)
//   MOCK_PORT=9000 MOCK_ACCOUNT=a MOCK_PASSWORD=b node e2e/mock-host.mjs

import { randomBytes } from 'node:crypto';
import { readFile } from 'node:fs/promises';
import { createServer } from 'node:http';
import { extname, join, normalize, resolve } from 'node:path';
import { fileURLToPath } from 'node:url';

const port = Number(process.env.MOCK_PORT ?? 8137);
const ACCOUNT = process.env.MOCK_ACCOUNT ?? 'admin';
const PASSWORD = process.env.MOCK_PASSWORD ?? 'admin';
const dist = resolve(fileURLToPath(new URL('../dist', import.meta.url)));

const TYPES = { '.html': 'text/html', '.js': 'text/javascript', '.css': 'text/css', '.map': 'application/json', '.svg': 'image/svg+xml', '.png': 'image/png' };
const MAX_BODY = 1 << 20;

const sessions = new Map(); // cookie id -> token
const tasks = new Map(); // task id -> { kind, start, params }
let taskSeq = 0;

const state = {
  rules: [
    { enable: true, rule_id: '0', router_protocol: 'tcp', router_port: '8080', ds_port: '80', serviceid: '', service_name: '' },
    { enable: false, rule_id: '1', router_protocol: 'udp', router_port: '5000-5010', ds_port: '5000-5010', serviceid: '', service_name: '' },
    { enable: true, rule_id: '2', router_protocol: 'tcp', router_port: '21', ds_port: '21', serviceid: 'ftp', service_name: '' },
  ],
  conf: null,
  dbVersion: 20240101,
  services: { ftp: ['ftp', 'ftp_pasv'], web: ['http', 'https'], sync: ['sync'] },
  forwarded: new Set(['ftp']),
};

const STEPS = ['check_interface_enable_step', 'check_gateway_setting_step', 'check_connect_wan_step', 'check_hops_lan2wan_step', 'check_dns_setting_step', 'detect_router_step'];
const EXTRA = [{ network_interface: 'eth0' }, { gateway_ip: '192.168.1.1' }, {}, { hops_number: 1 }, {}, {}];

const ok = (data = null) => ({ success: true, data });
const fail = (code, errors = null) => ({ success: false, error: { code, errors } });
const since = (t) => Date.now() - t.start;

function newTask(prefix, kind, params) {
  const id = `${prefix}${++taskSeq}`;
  tasks.set(id, { kind, start: Date.now(), params });
  return ok({ task_id: id });
}

function detectAnswer(t) {
  const n = Math.min(6, Math.floor(since(t) / 700)); // steps finished
  const progress = {};
  STEPS.forEach((s, i) => {
    progress[s] = i < n ? { status: 'success', ...EXTRA[i] } : { status: i === n ? 'processing' : 'initial', check_id: i + 1 };
    if (i < n) progress[s].check_id = i + 1;
  });
  if (n < 6) return { status: 'processing', percentage: [20, 30, 40, 70, 50, 80][n], progress };
  for (const s of STEPS) delete progress[s].check_id;
  return { status: 'success', percentage: 100, progress, support_upnp: 'yes', support_natpmp: 'no', router_brand: 'Acme', router_model: 'RT-3000', router_version: '1.2', upnp_pfpath: 'Acme: RT-3000 (1.2)', router_user_setting_name: '', router_max_rule: 32 };
}

function saveAnswer(t, id) {
  const ms = since(t);
  if (ms < 400) return ok({ status: 'processing', percentage: 5 });
  if (ms < 3400) {
    const f = (ms - 400) / 3000;
    return ok({ status: 'processing', percentage: Math.floor(f * 100), stage: f < 0.5 ? 'del' : 'add' });
  }
  tasks.delete(id);
  const p = t.params;
  if (Array.isArray(p.rules)) {
    const high = p.rules.find((r) => String(r.router_port).split(/[,-]/).some((x) => Number(x) > 60000));
    if (high) return fail(1521, { sec: '', key: '', append: { max_port: 60000 } });
    state.rules = p.rules;
  } else if (p.pf_policy) {
    for (const s of p.pf_policy.add ?? []) state.forwarded.add(s);
    for (const s of p.pf_policy.remove ?? []) state.forwarded.delete(s);
  }
  return ok({ status: 'success', percentage: 100 });
}

function testAnswer(t, id) {
  const keys = t.kind === 'test_serv' ? [].concat(t.params.service_id).map((s) => `${s}.tcp`) : state.rules.map((r) => r.rule_id);
  const ms = since(t);
  if (ms < 600) return ok({ status: 'wait' });
  const done = Math.floor((ms - 600) / 700);
  const rules = Object.fromEntries(keys.map((k, i) => [k, i < done ? (i % 2 ? 'closed' : 'open') : 'testing']));
  if (done < keys.length) return ok({ status: 'update', rules });
  tasks.delete(id);
  return ok({ status: 'success', rules });
}

function compatAnswer(t) {
  const n = Math.min(5, Math.floor(since(t) / 1500));
  const items = ['add', 'max', 'del', 'readd', 'con_s'];
  const test = items.map((name, i) => ({ test_item: name, status: i < n ? (name === 'max' ? '16' : 'success') : i === n ? 'processing' : 'unknown' }));
  return n < 5 ? { test, status: 'processing', percentage: Math.trunc((n / 5) * 90) } : { test, status: 'success', percentage: 100 };
}

function entry(api, method, p) {
  const key = `${api} ${method}`;
  const status = (fn) => {
    const t = tasks.get(p.task_id);
    return t ? fn(t, p.task_id) : fail(1500);
  };
  switch (key) {
    case 'ZARK.Core.PortForwarding get_current_process':
      return ok({ process: [...tasks.values()].some((t) => t.kind === 'save' || t.kind.startsWith('test_')) ? 'portforwarding' : [...tasks.values()].some((t) => t.kind === 'compat') ? 'autotest' : 'none' });
    case 'ZARK.Core.PortForwarding detect':
      return newTask('ZARK.Core.PortForwarding.detect', 'detect', p);
    case 'ZARK.Core.PortForwarding detect_status':
      return status((t, id) => {
        const a = detectAnswer(t);
        if (a.status === 'success') tasks.delete(id);
        return ok(a);
      });
    case 'ZARK.Core.PortForwarding.RouterConf get':
      return state.conf ? ok({ ...state.conf, router_port: String(state.conf.router_port ?? ''), router_max_rule: '32' }) : fail(1501);
    case 'ZARK.Core.PortForwarding.RouterConf set': {
      const { router_pass: _secret, router_account: _account, ...rest } = p;
      state.conf = { router_protocol: '', router_port: '', ...rest };
      return ok(null);
    }
    case 'ZARK.Core.PortForwarding.RouterList list':
      return ok({ routers: [['Acme', 'RT-3000', '1.2', false], ['Acme', 'RT-3000', 'generic', true], ['Bolt', 'X1', '2.0', false], ['Bolt', 'X2', '2.1', false]].map(([b, m, v, g]) => ({ router_brand: b, router_model: m, router_version: v, generic: g })) });
    case 'ZARK.Core.PortForwarding.RouterList update':
      return ok({ router_version: ++state.dbVersion });
    case 'ZARK.Core.PortForwarding.RouterList get':
      return state.conf ? ok({ support_change_port: true }) : fail(1501);
    case 'ZARK.Core.PortForwarding.Rules load':
      return ok(state.rules);
    case 'ZARK.Core.PortForwarding.Rules save':
      return newTask('ZARK.Core.PortForwarding.save_rules', 'save', p);
    case 'ZARK.Core.PortForwarding.Rules save_status':
      return status(saveAnswer);
    case 'ZARK.Core.PortForwarding.Rules test':
      return newTask('ZARK.Core.PortForwarding.test_rules', 'test_rules', p);
    case 'ZARK.Core.PortForwarding.Rules.Serv test':
      return newTask('ZARK.Core.PortForwarding.test_serv', 'test_serv', p);
    case 'ZARK.Core.PortForwarding.Rules test_status':
    case 'ZARK.Core.PortForwarding.Rules.Serv test_status':
      return status(testAnswer);
    case 'ZARK.Core.PortForwarding.Rules.Serv check': {
      const ids = Array.isArray(p.service_id) && p.service_id.length ? [...p.service_id].sort() : Object.keys(state.services).concat('unknownsvc');
      return ok({
        service_status: ids.map((id) => {
          const secs = state.services[id];
          if (!secs) return { service_id: id, status: 'unknown' };
          const v = state.forwarded.has(id) ? 'allow' : 'deny';
          return { service_id: id, status: v, port_info: Object.fromEntries(secs.map((s) => [s, v])) };
        }),
      });
    }
    case 'ZARK.Core.PortForwarding.Compatibility test':
      return newTask('ZARK.Core.PortForwarding.test_compatibility', 'compat', p);
    case 'ZARK.Core.PortForwarding.Compatibility test_status':
      return status((t, id) => {
        const a = compatAnswer(t);
        if (a.status !== 'processing') tasks.delete(id);
        return ok(a);
      });
    case 'ZARK.Core.PortForwarding.Compatibility stop':
      for (const [id, t] of tasks) if (t.kind === 'compat') tasks.delete(id);
      return ok(null);
    case 'ZARK.Core.PortForwarding.Compatibility upload':
      return ok(null);
    default:
      return fail(api.startsWith('ZARK.Core.PortForwarding') ? 103 : 102);
  }
}

function cookieId(req) {
  const m = /(?:^|;\s*)zark_mock=([^;]+)/.exec(req.headers.cookie ?? '');
  return m ? m[1] : null;
}

async function readBody(req) {
  let size = 0;
  const chunks = [];
  for await (const c of req) {
    size += c.length;
    if (size > MAX_BODY) throw new Error('too large');
    chunks.push(c);
  }
  return new URLSearchParams(Buffer.concat(chunks).toString('utf8'));
}

function send(res, status, body, headers = {}) {
  res.writeHead(status, { 'Content-Type': 'application/json', 'Cache-Control': 'no-store', ...headers });
  res.end(JSON.stringify(body));
}

async function api(req, res, path) {
  if (req.method !== 'POST') return send(res, 405, fail(101));
  let form;
  try {
    form = await readBody(req);
  } catch {
    return send(res, 413, fail(108));
  }
  if (path === '/webapi/auth.cgi') {
    if (form.get('method') === 'login') {
      if (form.get('account') !== ACCOUNT || form.get('passwd') !== PASSWORD) return send(res, 200, fail(105));
      const id = randomBytes(16).toString('hex');
      const token = randomBytes(16).toString('hex');
      sessions.set(id, token);
      return send(res, 200, ok({ token, account: ACCOUNT }), { 'Set-Cookie': `zark_mock=${id}; HttpOnly; SameSite=Strict; Path=/` });
    }
    if (form.get('method') === 'logout') {
      sessions.delete(cookieId(req));
      return send(res, 200, ok(null), { 'Set-Cookie': 'zark_mock=; Max-Age=0; Path=/' });
    }
    return send(res, 200, fail(103));
  }
  const token = sessions.get(cookieId(req));
  if (!token) return send(res, 200, fail(106));
  if (req.headers['x-zark-token'] !== token) return send(res, 200, fail(107));
  if (form.get('version') !== '1') return send(res, 200, fail(104));
  const params = {};
  for (const [k, v] of form) {
    if (k === 'api' || k === 'version' || k === 'method') continue;
    try {
      params[k] = JSON.parse(v);
    } catch {
      return send(res, 200, fail(101));
    }
  }
  return send(res, 200, entry(form.get('api') ?? '', form.get('method') ?? '', params));
}

async function file(res, path) {
  const rel = normalize(decodeURIComponent(path)).replace(/^(\.\.[/\\])+/, '');
  let full = join(dist, rel === '/' ? 'index.html' : rel);
  if (!full.startsWith(dist)) full = join(dist, 'index.html');
  try {
    const data = await readFile(full);
    res.writeHead(200, { 'Content-Type': TYPES[extname(full)] ?? 'application/octet-stream' });
    res.end(data);
  } catch {
    res.writeHead(404, { 'Content-Type': 'text/plain' });
    res.end('not found');
  }
}

createServer((req, res) => {
  const path = new URL(req.url ?? '/', 'http://localhost').pathname;
  const work = path.startsWith('/webapi/') ? api(req, res, path) : file(res, path);
  work.catch((e) => {
    console.error(e);
    if (!res.headersSent) send(res, 500, fail(100));
  });
}).listen(port, '127.0.0.1', () => {
  console.log(`mock host on http://127.0.0.1:${port}/ serving ${dist}; login ${ACCOUNT} / ${PASSWORD}`);
});
