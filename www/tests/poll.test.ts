import { afterEach, beforeEach, describe, expect, it, vi } from 'vitest';
import { ApiClient, ApiError, BAD_ANSWER, memoryStore } from '../src/api/client';
import { detect, runTask, saveRules } from '../src/api/portforward';
import { PollAbortedError, PollTimeoutError, poll } from '../src/poll';
import { fail, fakeHost, ok } from './fakeHost';

beforeEach(() => {
  vi.useFakeTimers();
});
afterEach(() => {
  vi.useRealTimers();
});

// Answers from a list, one per ask; the last one repeats.
function scripted<T>(answers: (T | Error)[]) {
  let i = 0;
  return vi.fn(async () => {
    const a = answers[Math.min(i++, answers.length - 1)]!;
    if (a instanceof Error) throw a;
    return a;
  });
}

describe('poll', () => {
  it('waits one interval, then asks until the answer is final', async () => {
    const ask = scripted([1, 2, 3, 4]);
    const onUpdate = vi.fn();
    const p = poll(ask, { intervalMs: 500, maxPolls: 10, isDone: (n) => n === 3, onUpdate });
    await vi.advanceTimersByTimeAsync(499);
    expect(ask).toHaveBeenCalledTimes(0);
    await vi.advanceTimersByTimeAsync(1);
    expect(ask).toHaveBeenCalledTimes(1);
    await vi.advanceTimersByTimeAsync(500);
    expect(ask).toHaveBeenCalledTimes(2);
    await vi.advanceTimersByTimeAsync(500);
    await expect(p).resolves.toBe(3);
    expect(ask).toHaveBeenCalledTimes(3);
    expect(onUpdate.mock.calls.map((c) => c[0])).toEqual([1, 2, 3]);
    await vi.advanceTimersByTimeAsync(5000);
    expect(ask).toHaveBeenCalledTimes(3);
  });

  it('gives up after maxPolls asks', async () => {
    const ask = scripted(['running']);
    const p = poll(ask, { intervalMs: 100, maxPolls: 4, isDone: () => false });
    const caught = p.catch((e: unknown) => e);
    await vi.advanceTimersByTimeAsync(10_000);
    const e = await caught;
    expect(e).toBeInstanceOf(PollTimeoutError);
    expect((e as PollTimeoutError).polls).toBe(4);
    expect(ask).toHaveBeenCalledTimes(4);
  });

  it('stops asking when the signal is aborted', async () => {
    const ask = scripted(['running']);
    const ctl = new AbortController();
    const p = poll(ask, { intervalMs: 100, maxPolls: 100, isDone: () => false, signal: ctl.signal });
    const caught = p.catch((e: unknown) => e);
    await vi.advanceTimersByTimeAsync(250);
    expect(ask).toHaveBeenCalledTimes(2);
    ctl.abort();
    expect(await caught).toBeInstanceOf(PollAbortedError);
    await vi.advanceTimersByTimeAsync(1000);
    expect(ask).toHaveBeenCalledTimes(2);
  });

  it('does not hand on an answer that arrives after the abort', async () => {
    const ctl = new AbortController();
    const onUpdate = vi.fn();
    const ask = vi.fn(async () => {
      ctl.abort();
      return 'late';
    });
    const caught = poll(ask, { intervalMs: 10, maxPolls: 5, isDone: () => true, onUpdate, signal: ctl.signal }).catch(
      (e: unknown) => e,
    );
    await vi.advanceTimersByTimeAsync(10);
    expect(await caught).toBeInstanceOf(PollAbortedError);
    expect(onUpdate).not.toHaveBeenCalled();
  });

  it('refuses an already aborted signal without asking', async () => {
    const ask = scripted([1]);
    const ctl = new AbortController();
    ctl.abort();
    await expect(poll(ask, { intervalMs: 10, maxPolls: 5, isDone: () => true, signal: ctl.signal })).rejects.toBeInstanceOf(
      PollAbortedError,
    );
    expect(ask).not.toHaveBeenCalled();
  });

  it('retries transient failures up to the limit in a row', async () => {
    const settling = new ApiError(109, null);
    const ask = scripted<string | Error>([settling, settling, 'a', settling, settling, 'done']);
    const p = poll(ask, {
      intervalMs: 100,
      maxPolls: 20,
      isDone: (a) => a === 'done',
      isTransient: (e) => e instanceof ApiError && e.code === 109,
      maxTransient: 2,
    });
    await vi.advanceTimersByTimeAsync(1000);
    await expect(p).resolves.toBe('done');
    expect(ask).toHaveBeenCalledTimes(6);
  });

  it('fails on one transient failure too many', async () => {
    const settling = new ApiError(109, null);
    const ask = scripted<string | Error>([settling, settling, settling, 'done']);
    const caught = poll(ask, {
      intervalMs: 100,
      maxPolls: 20,
      isDone: (a) => a === 'done',
      isTransient: () => true,
      maxTransient: 2,
    }).catch((e: unknown) => e);
    await vi.advanceTimersByTimeAsync(1000);
    expect(await caught).toBe(settling);
    expect(ask).toHaveBeenCalledTimes(3);
  });

  it('fails at once on any other failure', async () => {
    const err = new ApiError(1521, { append: { max_port: 1 } });
    const ask = scripted<string | Error>(['a', err, 'done']);
    const caught = poll(ask, { intervalMs: 100, maxPolls: 20, isDone: (a) => a === 'done' }).catch((e: unknown) => e);
    await vi.advanceTimersByTimeAsync(1000);
    expect(await caught).toBe(err);
    expect(ask).toHaveBeenCalledTimes(2);
  });

  it('needs at least one poll', async () => {
    await expect(poll(scripted([1]), { intervalMs: 1, maxPolls: 0, isDone: () => true })).rejects.toBeInstanceOf(RangeError);
  });
});

describe('runTask', () => {
  const client = (host: ReturnType<typeof fakeHost>) => {
    const store = memoryStore();
    store.save({ token: 't', account: 'a' });
    return new ApiClient({ fetch: host.fetch, store });
  };

  it('starts the job and polls its status method with the task id', async () => {
    let polls = 0;
    const host = fakeHost({
      'ZARK.Core.PortForwarding.Rules save': () => ok({ task_id: 'ZARK.Core.PortForwarding.save_rules-7' }),
      'ZARK.Core.PortForwarding.Rules save_status': () =>
        ++polls < 3 ? ok({ status: 'processing', percentage: 25 * polls, stage: 'del' }) : ok({ status: 'success', percentage: 100 }),
    });
    const onStarted = vi.fn();
    const p = saveRules(client(host), [], { intervalMs: 500, maxPolls: 10, onStarted });
    await vi.advanceTimersByTimeAsync(1500);
    await expect(p).resolves.toEqual({ status: 'success', percentage: 100 });
    expect(onStarted).toHaveBeenCalledWith('ZARK.Core.PortForwarding.save_rules-7');
    expect(host.callsTo('ZARK.Core.PortForwarding.Rules', 'save')[0]!.params).toEqual({ rules: [] });
    const statusCalls = host.callsTo('ZARK.Core.PortForwarding.Rules', 'save_status');
    expect(statusCalls).toHaveLength(3);
    expect(statusCalls.every((c) => c.params.task_id === 'ZARK.Core.PortForwarding.save_rules-7')).toBe(true);
  });

  it('does not take "success" below 100 for a finished save', async () => {
    let polls = 0;
    const host = fakeHost({
      'ZARK.Core.PortForwarding.Rules save': () => ok({ task_id: 't' }),
      'ZARK.Core.PortForwarding.Rules save_status': () =>
        ++polls === 1 ? ok({ status: 'success', percentage: 0 }) : ok({ status: 'success', percentage: 100 }),
    });
    const p = saveRules(client(host), [], { intervalMs: 100, maxPolls: 5 });
    await vi.advanceTimersByTimeAsync(500);
    await expect(p).resolves.toEqual({ status: 'success', percentage: 100 });
    expect(polls).toBe(2);
  });

  it('refuses a start answer without a task id', async () => {
    const host = fakeHost({ 'A go': () => ok({}) });
    await expect(
      runTask(client(host), 'A', 'go', 'go_status', {}, () => true, { intervalMs: 1, maxPolls: 1 }),
    ).rejects.toMatchObject({ code: BAD_ANSWER });
  });

  it('waits out a status method that has not answered yet (109)', async () => {
    let polls = 0;
    const host = fakeHost({
      'ZARK.Core.PortForwarding detect': () => ok({ task_id: 'd1' }),
      'ZARK.Core.PortForwarding detect_status': () =>
        ++polls <= 2 ? fail(109) : ok({ status: 'Success', percentage: 100, progress: {} }),
    });
    const p = detect(client(host), { intervalMs: 500, maxPolls: 10 });
    await vi.advanceTimersByTimeAsync(2000);
    await expect(p).resolves.toMatchObject({ status: 'Success' });
  });

  it('passes the error a job ended with on', async () => {
    const host = fakeHost({
      'ZARK.Core.PortForwarding.Rules save': () => ok({ task_id: 's' }),
      'ZARK.Core.PortForwarding.Rules save_status': () => fail(1524, { sec: '', key: '', append: { max_port: 32 } }),
    });
    const caught = saveRules(client(host), [], { intervalMs: 100, maxPolls: 5 }).catch((e: unknown) => e);
    await vi.advanceTimersByTimeAsync(200);
    expect(await caught).toMatchObject({ code: 1524 });
  });
});
