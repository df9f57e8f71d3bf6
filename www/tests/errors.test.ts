import { describe, expect, it } from 'vitest';
import { ApiError, BAD_ANSWER, NETWORK_ERROR } from '../src/api/client';
import { HostCode, ModuleCode } from '../src/api/codes';
import { describeError, errorMessage, errorText, errorValue } from '../src/api/errors';
import { BusyError } from '../src/jobs';
import { PollAbortedError, PollTimeoutError } from '../src/poll';

const fallback = describeError(new ApiError(4242, null));

describe('describeError', () => {
  const allCodes = [
    NETWORK_ERROR,
    BAD_ANSWER,
    ...Object.values(HostCode),
    ...Object.values(ModuleCode),
  ];

  it.each(allCodes)('gives code %i words of its own and advice', (code) => {
    const d = describeError(new ApiError(code, null));
    expect(d.code).toBe(code);
    expect(d.title.length).toBeGreaterThan(10);
    expect(d.advice.length).toBeGreaterThan(10);
    expect(d.title).not.toBe(fallback.title);
  });

  it('names an unknown code', () => {
    expect(fallback.title).toContain('4242');
  });

  it('shows the wait of a slowed-down login', () => {
    const d = describeError(new ApiError(105, { retry_after: 30 }), 'login');
    expect(d.title).toMatch(/slowed down/);
    expect(d.advice).toBe('Wait 30 seconds, then try again.');
    expect(describeError(new ApiError(105, { retry_after: 1 })).advice).toBe('Wait 1 second, then try again.');
  });

  it('tells a refused login apart from a refused method', () => {
    expect(describeError(new ApiError(105, null), 'login').title).toMatch(/login was refused/);
    expect(describeError(new ApiError(105, null), 'save').title).not.toMatch(/login/);
  });

  it('sends the user back to log in on 106 and 107', () => {
    expect(describeError(new ApiError(106, null)).advice).toBe('Log in again.');
    expect(describeError(new ApiError(107, null)).advice).toBe('Log in again.');
  });

  it('shows the port limit that a refused save carries under "append"', () => {
    const e = new ApiError(1521, { sec: '', key: '', append: { max_port: 60000 } });
    expect(describeError(e).title).toContain('(60000)');
    expect(describeError(e).advice).toBe('Use ports up to 60000.');
  });

  it('shows a limit given at the top of the error data', () => {
    expect(describeError(new ApiError(1524, { max_port: 32 })).title).toContain('at most 32');
    expect(describeError(new ApiError(1522, { max_port: 100 })).title).toContain('at most 100');
  });

  it('shows both limits of a range too long', () => {
    const t = describeError(new ApiError(1523, { append: { max_port: 65535, max_range: 100 } })).title;
    expect(t).toContain('at most 100');
    expect(t).toContain('highest port 65535');
  });

  it('says "the router’s limit" when the limit is missing', () => {
    expect(describeError(new ApiError(1521, null)).title).toContain('the router’s limit');
  });

  it('quotes the offending port and protocol texts', () => {
    expect(describeError(new ApiError(1525, { sec: '', key: '', append: '80-x' })).title).toContain('“80-x”');
    expect(describeError(new ApiError(1526, 'sctp')).title).toContain('“sctp”');
    expect(describeError(new ApiError(1525, null)).title).toBe('The router does not accept a port text.');
  });

  it('explains 1501 by what was being done', () => {
    const detect = describeError(new ApiError(1501, null), 'detect').title;
    const conf = describeError(new ApiError(1501, null), 'router-conf').title;
    const save = describeError(new ApiError(1501, null), 'save').title;
    expect(new Set([detect, conf, save]).size).toBe(3);
    expect(save).toMatch(/busy/);
  });

  it('names what failed for 1500', () => {
    expect(describeError(new ApiError(1500, null), 'save').title).toBe('The rules could not be saved.');
    expect(describeError(new ApiError(1500, null), 'router-list').advice).toMatch(/update it/);
  });

  it('describes poll timeouts, stops and busy refusals', () => {
    expect(describeError(new PollTimeoutError(10)).title).toMatch(/did not finish/);
    expect(describeError(new PollAbortedError()).title).toMatch(/Stopped/);
    const busy = describeError(new BusyError('The server is busy with a router compatibility test.'));
    expect(busy.title).toBe('The server is busy with a router compatibility test.');
    expect(busy.advice).toMatch(/Wait/);
    expect(busy.code).toBeNull();
  });

  it('passes other errors on with their message', () => {
    expect(describeError(new Error('boom')).title).toBe('boom');
    expect(describeError('odd').title).toBe('odd');
  });
});

describe('errorMessage', () => {
  it('is one line with title, advice and code', () => {
    expect(errorMessage(new ApiError(1503, null))).toBe(
      'The default gateway is unknown. Set a default gateway in the server’s network settings, then try again. (code 1503)',
    );
  });
});

describe('error data readers', () => {
  it('finds values at the top or under "append"', () => {
    expect(errorValue({ max_port: 1 }, 'max_port')).toBe(1);
    expect(errorValue({ append: { max_port: 2 } }, 'max_port')).toBe(2);
    expect(errorValue(null, 'max_port')).toBeUndefined();
    expect(errorValue('text', 'max_port')).toBeUndefined();
  });

  it('finds the offending text', () => {
    expect(errorText('abc')).toBe('abc');
    expect(errorText({ append: 'def' })).toBe('def');
    expect(errorText({ append: { max_port: 1 } })).toBeNull();
  });
});
