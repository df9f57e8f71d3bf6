// A stand-in for the host's fetch, for tests: answers entry.cgi and auth.cgi
// calls from handlers keyed "api method" and records every request.

import { vi } from 'vitest';

export interface Recorded {
  url: string;
  headers: Record<string, string>;
  form: URLSearchParams;
  api: string | null;
  method: string | null;
  // Parameters with their JSON text decoded.
  params: Record<string, unknown>;
}

export type Answer =
  | { success: true; data?: unknown }
  | { success: false; error: { code: number; errors?: unknown } };

export type Handler = (params: Record<string, unknown>, req: Recorded) => Answer | Promise<Answer>;

export const ok = (data?: unknown): Answer => ({ success: true, data });
export const fail = (code: number, errors?: unknown): Answer => ({ success: false, error: { code, errors } });

export function jsonResponse(body: unknown, status = 200): Response {
  return new Response(JSON.stringify(body), { status, headers: { 'Content-Type': 'application/json' } });
}

export function fakeHost(handlers: Record<string, Handler>) {
  const calls: Recorded[] = [];
  const fetch = vi.fn(async (input: RequestInfo | URL, init?: RequestInit) => {
    const url = String(input);
    const form = new URLSearchParams(String(init?.body ?? ''));
    const headers: Record<string, string> = {};
    for (const [k, v] of Object.entries((init?.headers ?? {}) as Record<string, string>)) headers[k] = v;
    const params: Record<string, unknown> = {};
    for (const [k, v] of form) {
      if (k === 'api' || k === 'version' || k === 'method') continue;
      if (url.endsWith('/auth.cgi')) {
        params[k] = v;
        continue;
      }
      params[k] = JSON.parse(v);
    }
    const rec: Recorded = { url, headers, form, api: form.get('api'), method: form.get('method'), params };
    calls.push(rec);
    const key = url.endsWith('/auth.cgi') ? `auth ${rec.method}` : `${rec.api} ${rec.method}`;
    const handler = handlers[key];
    if (!handler) return jsonResponse(fail(103));
    return jsonResponse(await handler(params, rec));
  });
  return {
    fetch: fetch as unknown as typeof globalThis.fetch,
    calls,
    callsTo: (api: string, method: string) => calls.filter((c) => c.api === api && c.method === method),
  };
}

// Lets pending promise callbacks run (with fake timers too).
export async function flush(times = 5): Promise<void> {
  for (let i = 0; i < times; i++) await Promise.resolve();
}
