// Bounded polling of a long job's status.
//
// Every poll loop of the page goes through poll(): it asks at a fixed
// interval, hands every answer to onUpdate, stops at the first answer that
// isDone accepts, and gives up after maxPolls asks (PollTimeoutError) or when
// the signal is aborted (PollAbortedError). Nothing polls forever.

export class PollTimeoutError extends Error {
  override name = 'PollTimeoutError';
  readonly polls: number;
  constructor(polls: number) {
    super(`no final answer after ${polls} polls`);
    this.polls = polls;
  }
}

export class PollAbortedError extends Error {
  override name = 'AbortError';
  constructor() {
    super('polling was stopped');
  }
}

export interface PollOptions<T> {
  intervalMs: number;
  maxPolls: number;
  isDone: (answer: T) => boolean;
  onUpdate?: (answer: T) => void;
  signal?: AbortSignal;
  // Wait before the first ask; defaults to intervalMs so that a job just
  // started has time to report.
  initialDelayMs?: number;
  // A failure for which isTransient is true is retried, up to maxTransient
  // such failures in a row; any other failure ends the polling at once.
  isTransient?: (err: unknown) => boolean;
  maxTransient?: number;
}

export function sleep(ms: number, signal?: AbortSignal): Promise<void> {
  return new Promise((resolve, reject) => {
    if (signal?.aborted) {
      reject(new PollAbortedError());
      return;
    }
    const onAbort = () => {
      clearTimeout(timer);
      reject(new PollAbortedError());
    };
    const timer = setTimeout(() => {
      signal?.removeEventListener('abort', onAbort);
      resolve();
    }, ms);
    signal?.addEventListener('abort', onAbort, { once: true });
  });
}

export async function poll<T>(ask: () => Promise<T>, opts: PollOptions<T>): Promise<T> {
  if (!(opts.maxPolls >= 1)) throw new RangeError('maxPolls must be at least 1');
  const maxTransient = opts.maxTransient ?? 0;
  let transientInRow = 0;

  await sleep(opts.initialDelayMs ?? opts.intervalMs, opts.signal);
  for (let n = 1; n <= opts.maxPolls; n++) {
    if (opts.signal?.aborted) throw new PollAbortedError();
    let answer: T;
    try {
      answer = await ask();
    } catch (e) {
      if (opts.signal?.aborted) throw new PollAbortedError();
      if (opts.isTransient?.(e) && transientInRow < maxTransient) {
        transientInRow++;
        if (n < opts.maxPolls) await sleep(opts.intervalMs, opts.signal);
        continue;
      }
      throw e;
    }
    transientInRow = 0;
    if (opts.signal?.aborted) throw new PollAbortedError();
    opts.onUpdate?.(answer);
    if (opts.isDone(answer)) return answer;
    if (n < opts.maxPolls) await sleep(opts.intervalMs, opts.signal);
  }
  throw new PollTimeoutError(opts.maxPolls);
}
