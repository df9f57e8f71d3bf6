// Turns every failure the page can meet into words: what happened and what
// the user can do about it.

import { ApiError, BAD_ANSWER, NETWORK_ERROR } from './client';
import { HostCode, ModuleCode } from './codes';

// What the failing call was doing; a few codes mean different things there.
export type ErrorContext =
  | 'login'
  | 'detect'
  | 'save'
  | 'test'
  | 'compat'
  | 'router-conf'
  | 'router-list'
  | 'rules'
  | 'services'
  | 'other';

export interface ErrorDescription {
  code: number | null;
  title: string;
  advice: string;
}

// Looks a value up in an error's data. An error that a background task ended
// with carries its data under "append" ({"sec", "key", "append"}); a direct
// answer carries it at the top.
export function errorValue(errors: unknown, key: string): unknown {
  if (!errors || typeof errors !== 'object') return undefined;
  const o = errors as Record<string, unknown>;
  if (key in o) return o[key];
  const app = o.append;
  if (app && typeof app === 'object' && key in (app as Record<string, unknown>)) {
    return (app as Record<string, unknown>)[key];
  }
  return undefined;
}

// The offending text of 1525/1526: the whole error data, or its "append".
export function errorText(errors: unknown): string | null {
  if (typeof errors === 'string') return errors;
  if (errors && typeof errors === 'object') {
    const app = (errors as Record<string, unknown>).append;
    if (typeof app === 'string') return app;
    for (const k of ['text', 'detail']) {
      const v = (errors as Record<string, unknown>)[k];
      if (typeof v === 'string') return v;
    }
  }
  return null;
}

function num(v: unknown): number | null {
  if (typeof v === 'number' && Number.isFinite(v)) return v;
  if (typeof v === 'string' && /^\d+$/.test(v)) return Number(v);
  return null;
}

const SYSLOG = 'the server’s system log has the details';

export function describeApiError(err: ApiError, ctx: ErrorContext = 'other'): ErrorDescription {
  const c = err.code;
  const d = (title: string, advice: string): ErrorDescription => ({ code: c, title, advice });
  const maxPort = num(errorValue(err.errors, 'max_port'));
  const maxRange = num(errorValue(err.errors, 'max_range'));
  const limit = (n: number | null) => (n === null ? 'the router’s limit' : String(n));

  switch (c) {
    case NETWORK_ERROR:
      return d(
        'The server could not be reached.',
        'Check the network connection to the server, then try again.',
      );
    case BAD_ANSWER:
      return d(
        err.message ? `The server sent an answer this page cannot read (${err.message}).` : 'The server sent an answer this page cannot read.',
        'Reload the page. If it happens again, the server may be restarting.',
      );
    case HostCode.Internal:
      return d('The server hit an internal error.', `Try again; ${SYSLOG}.`);
    case HostCode.BadField:
      return d(
        'The server found a required field missing or malformed.',
        'Reload the page and try again. If it repeats, this page and the server do not match.',
      );
    case HostCode.UnknownApi:
    case HostCode.UnknownMethod:
      return d(
        'The server does not offer this function.',
        'The port-forwarding module may not be loaded on the server. Check that it is installed, then reload.',
      );
    case HostCode.BadVersion:
      return d(
        'The server does not serve this version of the function.',
        'Reload the page to get the version that matches the server.',
      );
    case HostCode.NotAllowed: {
      const retry = num(errorValue(err.errors, 'retry_after'));
      if (retry !== null) {
        return d(
          'Too many login attempts: logins are slowed down for now.',
          `Wait ${retry} second${retry === 1 ? '' : 's'}, then try again.`,
        );
      }
      if (ctx === 'login') {
        return d('The login was refused.', 'Check the account name and password, then try again.');
      }
      return d(
        'Your account may not do this.',
        'Log in with an administrator account.',
      );
    }
    case HostCode.NotLoggedIn:
      return d('Your session has ended.', 'Log in again.');
    case HostCode.BadToken:
      return d('Your session is no longer valid here.', 'Log in again.');
    case HostCode.TooLarge:
      return d(
        'The request was too large for the server.',
        'Send fewer rules or services at once.',
      );
    case HostCode.NoAnswer:
      return d(
        'The server finished the request without an answer.',
        `Try again in a moment; ${SYSLOG}.`,
      );
    case HostCode.TaskCrashed:
      return d('The background job crashed.', `Try again; ${SYSLOG}.`);
    case HostCode.TaskNotStarted:
      return d(
        'The background job could not be started.',
        'The server may be busy. Try again in a moment.',
      );

    case ModuleCode.BadParameter:
      return d(
        'The server refused a parameter of the request.',
        'Reload the page and try again.',
      );
    case ModuleCode.TaskListFailed:
      return d('The server could not list its background jobs.', `Try again; ${SYSLOG}.`);
    case ModuleCode.Failed:
      return d(
        failedTitle(ctx),
        ctx === 'router-list'
          ? 'The router database may be empty: update it, then try again.'
          : `Try again; ${SYSLOG}.`,
      );
    case ModuleCode.Busy:
      if (ctx === 'detect') {
        return d(
          'Router detection could not start.',
          'Check that the network interface is up and no other job is running, then try again.',
        );
      }
      if (ctx === 'router-conf') {
        return d(
          'No router is configured for the current gateway, or the router is not supported.',
          'Detect the router or pick it from the list of known routers, then save its configuration.',
        );
      }
      return d(
        'The router is busy with another port-forwarding job, or no supported router is configured.',
        'Wait until the running job has finished, or set up the router on the Router screen, then try again.',
      );
    case ModuleCode.NoExternalAddress:
      return d(
        'The server’s external (internet) address is unknown.',
        'Check that the router is connected to the internet; the test needs the external address.',
      );
    case ModuleCode.NoGateway:
      return d(
        'The default gateway is unknown.',
        'Set a default gateway in the server’s network settings, then try again.',
      );
    case ModuleCode.RouterDbUpdateFailed:
      return d(
        'The router database could not be updated.',
        'Check the server’s internet connection and try again later.',
      );
    case ModuleCode.PortTooHigh:
      return d(
        `A port is above the highest port the router accepts (${limit(maxPort)}).`,
        `Use ports up to ${limit(maxPort)}.`,
      );
    case ModuleCode.TooManyPorts:
      return d(
        `A rule holds more ports than the router accepts in one rule (at most ${limit(maxPort)}).`,
        'Split the rule into several smaller rules.',
      );
    case ModuleCode.RangeTooLong:
      return d(
        `A port range is longer than the router accepts (range length at most ${limit(maxRange)}, highest port ${limit(maxPort)}).`,
        'Split the range into shorter ranges.',
      );
    case ModuleCode.TooManyRules:
      return d(
        `There are more rules than the router accepts (at most ${limit(maxPort)}).`,
        'Delete or merge rules, then save again.',
      );
    case ModuleCode.BadPortText: {
      const t = errorText(err.errors);
      return d(
        t ? `The router does not accept the port text “${t}”.` : 'The router does not accept a port text.',
        'Correct that port: use items like 80, 8000-8010 or 9000-, separated by commas.',
      );
    }
    case ModuleCode.BadProtocolText: {
      const t = errorText(err.errors);
      return d(
        t ? `The router does not accept the protocol “${t}”.` : 'The router does not accept a protocol.',
        'Choose TCP, UDP or both for that rule.',
      );
    }
    case ModuleCode.PolicyNotWritten:
      return d(
        'The rules for the services could not be written.',
        'An existing rule that maps several router ports to different local ports collides with a service’s ports. Edit or delete that rule on the Rules screen, then try again.',
      );
    case ModuleCode.RouterDbSyntax:
      return d(
        'The router database does not match this system’s version.',
        'Update the router database on the Router screen, then try again.',
      );
    case ModuleCode.ServiceCheckRefused:
      return d('The service check was refused.', 'Reload the page and try again.');
    default:
      return d(`The operation failed (code ${c}).`, `Try again; ${SYSLOG}.`);
  }
}

function failedTitle(ctx: ErrorContext): string {
  switch (ctx) {
    case 'detect':
      return 'Router detection failed.';
    case 'save':
      return 'The rules could not be saved.';
    case 'test':
      return 'The reachability test failed.';
    case 'compat':
      return 'The compatibility test request failed.';
    case 'router-conf':
      return 'The router configuration could not be read or stored.';
    case 'router-list':
      return 'The list of known routers could not be read.';
    case 'rules':
      return 'The rules could not be read.';
    case 'services':
      return 'The service check failed.';
    default:
      return 'The operation failed.';
  }
}

export function describeError(err: unknown, ctx: ErrorContext = 'other'): ErrorDescription {
  if (err instanceof ApiError) return describeApiError(err, ctx);
  if (err instanceof Error) {
    if (err.name === 'PollTimeoutError') {
      return {
        code: null,
        title: 'The job did not finish in the expected time; the page stopped following it.',
        advice: 'It may still be running on the server. Look again in a moment before starting it again.',
      };
    }
    if (err.name === 'BusyError') {
      return {
        code: null,
        title: err.message,
        advice: 'Wait until that job has finished, then start this one.',
      };
    }
    if (err.name === 'AbortError') {
      return { code: null, title: 'Stopped following the job.', advice: 'Start it again when needed.' };
    }
    return { code: null, title: err.message || 'Unexpected failure.', advice: 'Reload the page and try again.' };
  }
  return { code: null, title: String(err), advice: 'Reload the page and try again.' };
}

// One line of text: title, advice, and the code when there is one.
export function errorMessage(err: unknown, ctx: ErrorContext = 'other'): string {
  const d = describeError(err, ctx);
  return `${d.title} ${d.advice}${d.code !== null ? ` (code ${d.code})` : ''}`;
}
