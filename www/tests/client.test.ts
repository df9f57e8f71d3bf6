import { describe, expect, it, vi } from 'vitest';
import {
  ApiClient,
  ApiError,
  BAD_ANSWER,
  NETWORK_ERROR,
  TOKEN_HEADER,
  encodeEntryForm,
  memoryStore,
  sessionStorageStore,
} from '../src/api/client';
import { fail, fakeHost, ok } from './fakeHost';

describe('encodeEntryForm', () => {
  it('sends api, version 1, method and each parameter as JSON text', () => {
    const f = encodeEntryForm('ZARK.Core.PortForwarding.Rules', 'save', {
      rules: [{ router_port: '80', enable: true }],
      task_id: 'abc',
      n: 5,
      nothing: null,
    });
    expect(f.get('api')).toBe('ZARK.Core.PortForwarding.Rules');
    expect(f.get('version')).toBe('1');
    expect(f.get('method')).toBe('save');
    expect(f.get('rules')).toBe('[{"router_port":"80","enable":true}]');
    expect(f.get('task_id')).toBe('"abc"');
    expect(f.get('n')).toBe('5');
    expect(f.get('nothing')).toBe('null');
  });

  it('leaves undefined parameters out', () => {
    const f = encodeEntryForm('A', 'm', { a: undefined, b: 1 });
    expect(f.has('a')).toBe(false);
    expect([...f.keys()]).toEqual(['api', 'version', 'method', 'b']);
  });

  it('refuses parameter names that the protocol uses itself', () => {
    expect(() => encodeEntryForm('A', 'm', { method: 'x' })).toThrow(/reserved/);
  });
});

describe('ApiClient', () => {
  const loggedIn = (host: ReturnType<typeof fakeHost>, onSessionLost?: (e: ApiError) => void) => {
    const store = memoryStore();
    store.save({ token: 'tok-1', account: 'admin' });
    return new ApiClient({ fetch: host.fetch, store, onSessionLost });
  };

  it('logs in through auth.cgi and keeps the token for entry calls', async () => {
    const host = fakeHost({
      'auth login': () => ok({ token: 'T0K', account: 'admin' }),
      'ZARK.Core.PortForwarding get_current_process': () => ok({ process: 'none' }),
    });
    const store = memoryStore();
    const c = new ApiClient({ fetch: host.fetch, store });
    expect(c.loggedIn).toBe(false);
    const s = await c.login('admin', 'p&ss=word');
    expect(s).toEqual({ token: 'T0K', account: 'admin' });
    expect(store.load()).toEqual({ token: 'T0K', account: 'admin' });
    const login = host.calls[0]!;
    expect(login.url).toBe('/webapi/auth.cgi');
    expect(login.form.get('method')).toBe('login');
    expect(login.form.get('account')).toBe('admin');
    expect(login.form.get('passwd')).toBe('p&ss=word');

    const data = await c.call('ZARK.Core.PortForwarding', 'get_current_process');
    expect(data).toEqual({ process: 'none' });
    const call = host.calls[1]!;
    expect(call.url).toBe('/webapi/entry.cgi');
    expect(call.headers[TOKEN_HEADER]).toBe('T0K');
    expect(call.headers['Content-Type']).toMatch(/^application\/x-www-form-urlencoded/);
  });

  it('sends method, credentials and no-store on every POST', async () => {
    const host = fakeHost({ 'A m': () => ok(1) });
    await loggedIn(host).call('A', 'm');
    const init = vi.mocked(host.fetch as unknown as (u: string, i: RequestInit) => Promise<Response>).mock.calls[0]![1];
    expect(init.method).toBe('POST');
    expect(init.credentials).toBe('same-origin');
    expect(init.cache).toBe('no-store');
  });

  it('refuses a login answer without a token', async () => {
    const host = fakeHost({ 'auth login': () => ok({ account: 'admin' }) });
    const c = new ApiClient({ fetch: host.fetch });
    await expect(c.login('admin', 'x')).rejects.toMatchObject({ code: BAD_ANSWER });
    expect(c.loggedIn).toBe(false);
  });

  it('passes a refused login on with its code and data', async () => {
    const host = fakeHost({ 'auth login': () => fail(105, { retry_after: 30 }) });
    const c = new ApiClient({ fetch: host.fetch });
    const err = await c.login('admin', 'x').catch((e: unknown) => e);
    expect(err).toBeInstanceOf(ApiError);
    expect(err).toMatchObject({ code: 105, errors: { retry_after: 30 } });
  });

  it('turns an error answer into an ApiError with code and error data', async () => {
    const host = fakeHost({ 'R save_status': () => fail(1521, { sec: '', key: '', append: { max_port: 9999 } }) });
    const err = await loggedIn(host).call('R', 'save_status', { task_id: 't' }).catch((e: unknown) => e);
    expect(err).toBeInstanceOf(ApiError);
    expect(err).toMatchObject({ code: 1521, errors: { append: { max_port: 9999 } }, api: 'R', method: 'save_status' });
  });

  it('returns null for a success answer without data', async () => {
    const host = fakeHost({ 'A m': () => ({ success: true }) });
    await expect(loggedIn(host).call('A', 'm')).resolves.toBeNull();
  });

  it.each([106, 107])('forgets the session and reports code %i', async (code) => {
    const host = fakeHost({ 'A m': () => fail(code) });
    const lost = vi.fn();
    const c = loggedIn(host, lost);
    await expect(c.call('A', 'm')).rejects.toMatchObject({ code });
    expect(lost).toHaveBeenCalledTimes(1);
    expect(lost.mock.calls[0]![0]).toMatchObject({ code });
    expect(c.loggedIn).toBe(false);
  });

  it('keeps the session on other errors', async () => {
    const host = fakeHost({ 'A m': () => fail(1500) });
    const lost = vi.fn();
    const c = loggedIn(host, lost);
    await expect(c.call('A', 'm')).rejects.toMatchObject({ code: 1500 });
    expect(lost).not.toHaveBeenCalled();
    expect(c.loggedIn).toBe(true);
  });

  it('reports an unreachable server as a network error', async () => {
    const c = new ApiClient({ fetch: vi.fn().mockRejectedValue(new TypeError('Failed to fetch')) });
    await expect(c.call('A', 'm')).rejects.toMatchObject({ code: NETWORK_ERROR });
  });

  it('reports a body that is not JSON with the HTTP status', async () => {
    const c = new ApiClient({ fetch: vi.fn().mockResolvedValue(new Response('<html>502</html>', { status: 502 })) });
    await expect(c.call('A', 'm')).rejects.toMatchObject({ code: BAD_ANSWER, httpStatus: 502 });
  });

  it('reports JSON that is not the envelope', async () => {
    const c = new ApiClient({ fetch: vi.fn().mockResolvedValue(new Response('{"ok":1}', { status: 200 })) });
    await expect(c.call('A', 'm')).rejects.toMatchObject({ code: BAD_ANSWER });
  });

  it('forgets the session on logout even when the server cannot be told', async () => {
    const c = new ApiClient({ fetch: vi.fn().mockRejectedValue(new TypeError('down')), store: memoryStore() });
    (c as unknown as { session: unknown }).session = { token: 't', account: 'a' };
    await expect(c.logout()).rejects.toMatchObject({ code: NETWORK_ERROR });
    expect(c.loggedIn).toBe(false);
  });

  it('sends logout with the token', async () => {
    const host = fakeHost({ 'auth logout': () => ok(null) });
    const c = loggedIn(host);
    await c.logout();
    expect(host.calls[0]!.form.get('method')).toBe('logout');
    expect(host.calls[0]!.headers[TOKEN_HEADER]).toBe('tok-1');
    expect(c.loggedIn).toBe(false);
  });
});

describe('sessionStorageStore', () => {
  it('keeps a session for the tab and removes it', () => {
    const s = sessionStorageStore('test.session');
    s.save({ token: 'a', account: 'b' });
    expect(sessionStorageStore('test.session').load()).toEqual({ token: 'a', account: 'b' });
    s.save(null);
    expect(s.load()).toBeNull();
  });

  it('ignores a damaged entry', () => {
    window.sessionStorage.setItem('test.bad', '{"token":1}');
    expect(sessionStorageStore('test.bad').load()).toBeNull();
    window.sessionStorage.setItem('test.bad', 'not json');
    expect(sessionStorageStore('test.bad').load()).toBeNull();
  });
});
