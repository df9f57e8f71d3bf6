// Client of the web API host.
//
// Wire protocol:
//   POST /webapi/entry.cgi, application/x-www-form-urlencoded, with the fields
//   "api", "version" (1), "method", and one field per parameter whose value
//   is JSON text. Header "X-ZARK-Token: <token>" on every call.
//   Answer: {"success": true, "data": ...}
//        or {"success": false, "error": {"code": N, "errors": ...}}
//   POST /webapi/auth.cgi method=login&account=..&passwd=.. answers
//   {"success": true, "data": {"token": "...", "account": "..."}} and sets an
//   HttpOnly session cookie; method=logout ends the session.

import { HostCode } from './codes';

export const ENTRY_PATH = '/webapi/entry.cgi';
export const AUTH_PATH = '/webapi/auth.cgi';
export const TOKEN_HEADER = 'X-ZARK-Token';
export const API_VERSION = 1;

// Code given to failures that never reached a JSON answer of the host.
export const NETWORK_ERROR = 0;
// Code given to answers that are not the host's JSON envelope.
export const BAD_ANSWER = -1;

export class ApiError extends Error {
  readonly code: number;
  readonly errors: unknown;
  readonly httpStatus: number | undefined;
  readonly api: string | undefined;
  readonly method: string | undefined;

  constructor(
    code: number,
    errors: unknown,
    opts: { message?: string; httpStatus?: number; api?: string; method?: string } = {},
  ) {
    super(opts.message ?? `request failed with code ${code}`);
    this.name = 'ApiError';
    this.code = code;
    this.errors = errors;
    this.httpStatus = opts.httpStatus;
    this.api = opts.api;
    this.method = opts.method;
  }
}

export function isApiError(e: unknown): e is ApiError {
  return e instanceof ApiError;
}

export type Params = Record<string, unknown>;

// Builds the form body of one entry call. Every parameter value is sent as
// JSON text (a plain string becomes a JSON string); undefined values are left
// out so that "absent" stays distinguishable from null.
export function encodeEntryForm(api: string, method: string, params: Params = {}): URLSearchParams {
  const form = new URLSearchParams();
  form.set('api', api);
  form.set('version', String(API_VERSION));
  form.set('method', method);
  for (const [name, value] of Object.entries(params)) {
    if (value === undefined) continue;
    if (name === 'api' || name === 'version' || name === 'method') {
      throw new Error(`parameter name "${name}" is reserved by the wire protocol`);
    }
    form.set(name, JSON.stringify(value));
  }
  return form;
}

export interface Session {
  token: string;
  account: string;
}

// Where the session token is kept between page loads of one tab. The token
// alone opens nothing: the host also wants its HttpOnly cookie.
export interface TokenStore {
  load(): Session | null;
  save(session: Session | null): void;
}

export function sessionStorageStore(key = 'zark.pf.session'): TokenStore {
  return {
    load() {
      try {
        const text = window.sessionStorage.getItem(key);
        if (!text) return null;
        const v = JSON.parse(text) as Partial<Session>;
        return typeof v.token === 'string' && typeof v.account === 'string'
          ? { token: v.token, account: v.account }
          : null;
      } catch {
        return null;
      }
    },
    save(session) {
      try {
        if (session) window.sessionStorage.setItem(key, JSON.stringify(session));
        else window.sessionStorage.removeItem(key);
      } catch {
        // Storage may be disabled; the session then lasts until reload.
      }
    },
  };
}

export function memoryStore(): TokenStore {
  let s: Session | null = null;
  return {
    load: () => s,
    save: (v) => {
      s = v;
    },
  };
}

export interface ClientOptions {
  baseUrl?: string;
  fetch?: typeof fetch;
  store?: TokenStore;
  // Called once per failing call whose code says the session is gone
  // (106 not logged in / expired, 107 bad token). The session is already
  // forgotten when it runs.
  onSessionLost?: (err: ApiError) => void;
}

interface Envelope {
  success: boolean;
  data?: unknown;
  error?: { code?: unknown; errors?: unknown };
}

export class ApiClient {
  private readonly baseUrl: string;
  private readonly fetchFn: typeof fetch;
  private readonly store: TokenStore;
  private session: Session | null;
  onSessionLost: ((err: ApiError) => void) | undefined;

  constructor(opts: ClientOptions = {}) {
    this.baseUrl = (opts.baseUrl ?? '').replace(/\/+$/, '');
    this.fetchFn = opts.fetch ?? ((input, init) => globalThis.fetch(input, init));
    this.store = opts.store ?? memoryStore();
    this.session = this.store.load();
    this.onSessionLost = opts.onSessionLost;
  }

  get loggedIn(): boolean {
    return this.session !== null;
  }

  get account(): string | null {
    return this.session?.account ?? null;
  }

  async login(account: string, passwd: string): Promise<Session> {
    const form = new URLSearchParams({ method: 'login', account, passwd });
    const data = await this.post(AUTH_PATH, form, { api: 'auth', method: 'login' }, false);
    const d = (data ?? {}) as { token?: unknown; account?: unknown };
    if (typeof d.token !== 'string' || d.token === '') {
      throw new ApiError(BAD_ANSWER, null, {
        message: 'the login answer carries no token',
        api: 'auth',
        method: 'login',
      });
    }
    const session = { token: d.token, account: typeof d.account === 'string' ? d.account : account };
    this.setSession(session);
    return session;
  }

  // Ends the session on the host. The local session is forgotten even when
  // the host cannot be reached; the error is still passed on to the caller.
  async logout(): Promise<void> {
    const form = new URLSearchParams({ method: 'logout' });
    try {
      await this.post(AUTH_PATH, form, { api: 'auth', method: 'logout' }, false);
    } finally {
      this.setSession(null);
    }
  }

  forgetSession(): void {
    this.setSession(null);
  }

  async call<T = unknown>(api: string, method: string, params: Params = {}): Promise<T> {
    const form = encodeEntryForm(api, method, params);
    return (await this.post(ENTRY_PATH, form, { api, method }, true)) as T;
  }

  private setSession(session: Session | null): void {
    this.session = session;
    this.store.save(session);
  }

  private async post(
    path: string,
    form: URLSearchParams,
    what: { api: string; method: string },
    watchSession: boolean,
  ): Promise<unknown> {
    const headers: Record<string, string> = {
      'Content-Type': 'application/x-www-form-urlencoded; charset=UTF-8',
      Accept: 'application/json',
    };
    if (this.session) headers[TOKEN_HEADER] = this.session.token;

    let res: Response;
    try {
      res = await this.fetchFn(this.baseUrl + path, {
        method: 'POST',
        headers,
        body: form.toString(),
        credentials: 'same-origin',
        cache: 'no-store',
      });
    } catch (e) {
      throw new ApiError(NETWORK_ERROR, null, {
        message: `the server could not be reached (${e instanceof Error ? e.message : String(e)})`,
        ...what,
      });
    }

    let body: unknown;
    try {
      body = await res.json();
    } catch {
      throw new ApiError(BAD_ANSWER, null, {
        message: `the server answered HTTP ${res.status} without a JSON body`,
        httpStatus: res.status,
        ...what,
      });
    }
    const env = body as Envelope;
    if (!env || typeof env !== 'object' || typeof env.success !== 'boolean') {
      throw new ApiError(BAD_ANSWER, body, {
        message: `the server answered HTTP ${res.status} with an unknown JSON shape`,
        httpStatus: res.status,
        ...what,
      });
    }
    if (env.success) return env.data ?? null;

    const code = typeof env.error?.code === 'number' ? env.error.code : BAD_ANSWER;
    const err = new ApiError(code, env.error?.errors ?? null, { httpStatus: res.status, ...what });
    if (watchSession && (code === HostCode.NotLoggedIn || code === HostCode.BadToken)) {
      this.setSession(null);
      this.onSessionLost?.(err);
    }
    throw err;
  }
}
