import { describe, expect, it, vi } from 'vitest';
import { ApiClient, memoryStore } from '../src/api/client';
import { BusyError, JobGuard, ensureRouterIdle, runExclusive } from '../src/jobs';
import { fail, fakeHost, ok } from './fakeHost';

const client = (process: unknown) => {
  const host = fakeHost({
    'ZARK.Core.PortForwarding get_current_process': () => (process instanceof Error ? fail(1500) : ok(process)),
  });
  const store = memoryStore();
  store.save({ token: 't', account: 'a' });
  return { host, client: new ApiClient({ fetch: host.fetch, store }) };
};

describe('JobGuard', () => {
  it('holds one job at a time and tells listeners', () => {
    const g = new JobGuard();
    const seen: (string | null)[] = [];
    g.subscribe((r) => seen.push(r));
    expect(g.tryBegin('a')).toBe(true);
    expect(g.tryBegin('b')).toBe(false);
    g.end('b'); // not the holder: no effect
    expect(g.running).toBe('a');
    g.end('a');
    expect(g.tryBegin('b')).toBe(true);
    expect(seen).toEqual(['a', null, 'b']);
  });
});

describe('ensureRouterIdle', () => {
  it('passes when the library runs nothing', async () => {
    await expect(ensureRouterIdle(client({ process: 'none' }).client)).resolves.toBeUndefined();
  });

  it.each([
    ['autotest', 'The server is busy with a router compatibility test.'],
    ['portforwarding', 'The server is busy with applying or testing port-forwarding rules.'],
    ['other', 'The server is busy with another job (“other”).'],
  ])('refuses while the library runs %s', async (process, message) => {
    const e = await ensureRouterIdle(client({ process }).client).catch((x: unknown) => x);
    expect(e).toBeInstanceOf(BusyError);
    expect((e as Error).message).toBe(message);
  });

  it('refuses an answer without "process"', async () => {
    await expect(ensureRouterIdle(client({}).client)).rejects.toBeInstanceOf(BusyError);
  });

  it('passes a failed check on', async () => {
    await expect(ensureRouterIdle(client(new Error()).client)).rejects.toMatchObject({ code: 1500 });
  });
});

describe('runExclusive', () => {
  it('runs the job when idle and frees the slot afterwards', async () => {
    const { client: c } = client({ process: 'none' });
    const g = new JobGuard();
    const job = vi.fn(async () => 42);
    await expect(runExclusive(c, g, 'saving rules', job)).resolves.toBe(42);
    expect(job).toHaveBeenCalledTimes(1);
    expect(g.running).toBeNull();
  });

  it('refuses a second job of the page without asking the server', async () => {
    const { client: c, host } = client({ process: 'none' });
    const g = new JobGuard();
    g.tryBegin('router detection');
    const job = vi.fn(async () => 1);
    await expect(runExclusive(c, g, 'saving rules', job)).rejects.toThrow('This page is already running: router detection.');
    expect(job).not.toHaveBeenCalled();
    expect(host.calls).toHaveLength(0);
  });

  it('does not run the job while the server is busy, and frees the slot', async () => {
    const { client: c } = client({ process: 'autotest' });
    const g = new JobGuard();
    const job = vi.fn(async () => 1);
    await expect(runExclusive(c, g, 'saving rules', job)).rejects.toBeInstanceOf(BusyError);
    expect(job).not.toHaveBeenCalled();
    expect(g.running).toBeNull();
  });

  it('frees the slot when the job fails', async () => {
    const { client: c } = client({ process: 'none' });
    const g = new JobGuard();
    await expect(runExclusive(c, g, 'x', async () => Promise.reject(new Error('bad')))).rejects.toThrow('bad');
    expect(g.running).toBeNull();
  });
});
