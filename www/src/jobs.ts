// One long job at a time.
//
// The page runs at most one long job (detection, saving, a test, the
// compatibility test) itself, and before starting one it asks the server
// which job the port-map library is busy with (get_current_process), so that
// a second job is refused in words instead of colliding on the router.

import type { ApiClient } from './api/client';
import { getCurrentProcess } from './api/portforward';

export class BusyError extends Error {
  override name = 'BusyError';
}

export const PROCESS_TEXT: Record<string, string> = {
  autotest: 'a router compatibility test',
  portforwarding: 'applying or testing port-forwarding rules',
};

export class JobGuard {
  private current: string | null = null;
  private readonly listeners = new Set<(running: string | null) => void>();

  get running(): string | null {
    return this.current;
  }

  // Takes the page's job slot; false when another job holds it.
  tryBegin(label: string): boolean {
    if (this.current !== null) return false;
    this.current = label;
    this.emit();
    return true;
  }

  end(label: string): void {
    if (this.current !== label) return;
    this.current = null;
    this.emit();
  }

  subscribe(fn: (running: string | null) => void): () => void {
    this.listeners.add(fn);
    return () => this.listeners.delete(fn);
  }

  private emit(): void {
    for (const fn of this.listeners) fn(this.current);
  }
}

// Resolves when the server's port-map library runs no job; throws BusyError
// naming the job otherwise. A failure to ask is passed on: starting blind
// could collide with a job we cannot see.
export async function ensureRouterIdle(client: ApiClient): Promise<void> {
  const answer = await getCurrentProcess(client);
  const p = answer?.process;
  if (typeof p !== 'string') {
    throw new BusyError('The server did not say whether another job is running.');
  }
  if (p !== 'none') {
    throw new BusyError(
      `The server is busy with ${PROCESS_TEXT[p] ?? `another job (“${p}”)`}.`,
    );
  }
}

// Runs fn as the page's one long job, after checking that the server is idle.
export async function runExclusive<T>(
  client: ApiClient,
  jobs: JobGuard,
  label: string,
  fn: () => Promise<T>,
): Promise<T> {
  if (!jobs.tryBegin(label)) {
    throw new BusyError(`This page is already running: ${jobs.running}.`);
  }
  try {
    await ensureRouterIdle(client);
    return await fn();
  } finally {
    jobs.end(label);
  }
}
