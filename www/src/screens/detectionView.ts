// Renders a detection answer (detect_status) as a checklist of the six steps
// and, once the run is over, its outcome and the detected router.

import {
  STEP_ORDER,
  isDetectFinished,
  type DetectAnswer,
  type DetectStep,
  type StepName,
} from '../api/portforward';
import { h } from '../dom';

export const STEP_LABEL: Record<StepName, string> = {
  check_interface_enable_step: 'Network interface is enabled',
  check_gateway_setting_step: 'Default gateway is set',
  check_connect_wan_step: 'Internet (WAN) is reachable',
  check_hops_lan2wan_step: 'Hops from the local network to the internet',
  check_dns_setting_step: 'DNS server is set',
  detect_router_step: 'Router is detected',
};

const STEP_FAILED_ADVICE: Record<StepName, string> = {
  check_interface_enable_step: 'Enable the server’s network interface and check its cable.',
  check_gateway_setting_step: 'Set a default gateway (your router) in the server’s network settings.',
  check_connect_wan_step: 'Check that the router is connected to the internet.',
  check_hops_lan2wan_step: 'The route to the internet could not be traced; check the network between the server and the router.',
  check_dns_setting_step: 'Set a DNS server in the server’s network settings.',
  detect_router_step:
    'The router answered neither UPnP nor NAT-PMP. Enable one of them on the router, or pick the router from the list of known routers.',
};

export const STATUS_TEXT: Record<string, string> = {
  initial: 'Waiting',
  processing: 'Checking…',
  success: 'Passed',
  warning: 'Passed with a warning',
  failed: 'Failed',
  stop: 'Not reached',
};

const STATUS_MARK: Record<string, string> = {
  initial: '○',
  processing: '◌',
  success: '✓',
  warning: '!',
  failed: '✗',
  stop: '–',
};

export function warningText(step: StepName, s: DetectStep): string | null {
  if (s.status !== 'warning') return null;
  switch (s.warning_type) {
    case 'get_hops_fail':
      return 'The number of hops to the internet could not be found.';
    case 'hops_over_one':
      return 'There is more than one router between this server and the internet: forwarding ports on the nearest router alone may not make the server reachable.';
    case undefined:
    case '':
      return step === 'check_gateway_setting_step'
        ? 'The gateway setting looks unusual: check that the default gateway is your router.'
        : 'This step finished with a warning.';
    default:
      return `This step finished with a warning (${s.warning_type}).`;
  }
}

export function stepDetails(s: DetectStep): string[] {
  const out: string[] = [];
  if (typeof s.network_interface === 'string' && s.network_interface !== '') {
    out.push(`Interface: ${s.network_interface}`);
  }
  if (typeof s.gateway_ip === 'string' && s.gateway_ip !== '') out.push(`Gateway: ${s.gateway_ip}`);
  if (typeof s.hops_number === 'number') out.push(`Hops: ${s.hops_number}`);
  return out;
}

export function stepOf(a: DetectAnswer | null, name: StepName): DetectStep {
  const s = a?.progress?.[name];
  return s && typeof s === 'object' && typeof s.status === 'string' ? s : { status: 'initial' };
}

// The step at which a finished run stopped, if any.
export function failedStep(a: DetectAnswer | null): StepName | null {
  return STEP_ORDER.find((n) => stepOf(a, n).status === 'failed') ?? null;
}

// Steps finished so far (success or warning).
export function finishedSteps(a: DetectAnswer | null): number {
  return STEP_ORDER.filter((n) => {
    const st = stepOf(a, n).status;
    return st === 'success' || st === 'warning';
  }).length;
}

export function renderChecklist(a: DetectAnswer | null): HTMLOListElement {
  return h(
    'ol',
    { class: 'checklist', 'aria-label': 'Detection steps' },
    STEP_ORDER.map((name) => {
      const s = stepOf(a, name);
      const warn = warningText(name, s);
      const details = stepDetails(s);
      return h(
        'li',
        { class: `step step-${s.status}`, dataset: { step: name, status: String(s.status) } },
        h('span', { class: 'mark', 'aria-hidden': 'true' }, STATUS_MARK[s.status] ?? '?'),
        h('span', { class: 'label' }, STEP_LABEL[name]),
        h('span', { class: 'state' }, STATUS_TEXT[s.status] ?? String(s.status)),
        details.length > 0 ? h('span', { class: 'details' }, details.join(' · ')) : null,
        warn ? h('span', { class: 'warning' }, warn) : null,
        s.status === 'failed' ? h('span', { class: 'advice' }, STEP_FAILED_ADVICE[name]) : null,
      );
    }),
  );
}

const SUPPORT_TEXT: Record<string, string> = { yes: 'Yes', no: 'No', unknown: 'Unknown' };

export function supportText(v: string | undefined): string {
  return v === undefined ? '—' : (SUPPORT_TEXT[v] ?? v);
}

// True when the finished answer describes a detected router.
export function hasRouter(a: DetectAnswer | null): boolean {
  return (
    !!a &&
    isDetectFinished(a) &&
    failedStep(a) === null &&
    (a.router_brand !== undefined || a.support_upnp !== undefined)
  );
}

export function renderRouterFound(a: DetectAnswer): HTMLElement {
  const row = (label: string, value: string | number | undefined) =>
    h('div', { class: 'kv' }, h('dt', null, label), h('dd', null, value === undefined || value === '' ? '—' : String(value)));
  return h(
    'dl',
    { class: 'router-found' },
    row('Brand', a.router_brand),
    row('Model', a.router_model),
    row('Version', a.router_version),
    row('UPnP', supportText(a.support_upnp)),
    row('NAT-PMP', supportText(a.support_natpmp)),
    row('Name over UPnP', a.upnp_pfpath),
    row('Configuration in use', a.router_user_setting_name),
    row('Maximum rules', typeof a.router_max_rule === 'number' && a.router_max_rule > 0 ? a.router_max_rule : undefined),
  );
}

// One line about where the run is.
export function detectionSummary(a: DetectAnswer | null): {
  kind: 'idle' | 'running' | 'failed' | 'done';
  text: string;
} {
  if (!a) return { kind: 'idle', text: 'Detection has not run on this page yet.' };
  if (!isDetectFinished(a)) {
    const current = STEP_ORDER.find((n) => stepOf(a, n).status === 'processing');
    const done = finishedSteps(a);
    return {
      kind: 'running',
      text: current
        ? `Step ${STEP_ORDER.indexOf(current) + 1} of 6: ${STEP_LABEL[current]}`
        : `Starting (${done} of 6 steps done)`,
    };
  }
  if (a.status.toLowerCase() === 'failed') {
    const f = failedStep(a);
    return { kind: 'failed', text: f ? `Detection stopped at: ${STEP_LABEL[f]}.` : 'Detection failed.' };
  }
  const f = failedStep(a);
  if (f) return { kind: 'failed', text: `Detection stopped at: ${STEP_LABEL[f]}.` };
  const warnings = STEP_ORDER.filter((n) => stepOf(a, n).status === 'warning').length;
  return warnings > 0
    ? { kind: 'done', text: `Detection finished with ${warnings} warning${warnings > 1 ? 's' : ''}: read them below.` }
    : { kind: 'done', text: 'Detection finished: all six checks passed.' };
}

export function renderDetection(a: DetectAnswer | null): HTMLElement {
  const sum = detectionSummary(a);
  return h(
    'div',
    { class: 'detection' },
    h('p', { class: `detect-summary detect-${sum.kind}` }, sum.text),
    renderChecklist(a),
    a && hasRouter(a) ? [h('h4', null, 'Detected router'), renderRouterFound(a)] : null,
  );
}
