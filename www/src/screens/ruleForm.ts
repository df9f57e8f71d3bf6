// Adding and editing one rule, with the port syntax checked before anything
// is sent.

import type { Rule } from '../api/portforward';
import { h } from '../dom';
import { countPorts, parsePorts } from '../ports';

export const PROTOCOLS = ['tcp', 'udp', 'both'] as const;

export interface RuleDraft {
  enable: boolean;
  protocol: string;
  routerPort: string;
  localPort: string;
}

export type RuleCheck =
  | { ok: true; fields: Pick<Rule, 'enable' | 'router_protocol' | 'router_port' | 'ds_port'> }
  | { ok: false; field: 'protocol' | 'routerPort' | 'localPort'; error: string };

// supportChangePort: whether the router can forward a router port to a
// different local port (RouterList get); null when unknown.
export function validateRule(d: RuleDraft, supportChangePort: boolean | null): RuleCheck {
  if (!(PROTOCOLS as readonly string[]).includes(d.protocol)) {
    return { ok: false, field: 'protocol', error: 'Choose TCP, UDP or both.' };
  }
  const router = parsePorts(d.routerPort);
  if (!router.ok) return { ok: false, field: 'routerPort', error: `Router port: ${router.error}` };
  // An empty local port forwards to the same port numbers.
  const local = d.localPort.trim() === '' ? router : parsePorts(d.localPort);
  if (!local.ok) return { ok: false, field: 'localPort', error: `Local port: ${local.error}` };
  if (router.text !== local.text) {
    if (supportChangePort === false) {
      return {
        ok: false,
        field: 'localPort',
        error: 'This router cannot forward to a different local port: make the local ports the same as the router ports.',
      };
    }
    const open = [...router.items, ...local.items].some((i) => i.to === null);
    const nr = countPorts(router.items);
    const nl = countPorts(local.items);
    if (!open && nr !== nl) {
      return {
        ok: false,
        field: 'localPort',
        error: `The router ports and the local ports must cover as many ports each (router: ${nr}, local: ${nl}).`,
      };
    }
  }
  return {
    ok: true,
    fields: { enable: d.enable, router_protocol: d.protocol, router_port: router.text, ds_port: local.text },
  };
}

// A rule id not used yet: the next number after the highest numeric id.
export function nextRuleId(rules: Rule[]): string {
  let max = -1;
  const used = new Set(rules.map((r) => r.rule_id));
  for (const r of rules) if (/^\d+$/.test(r.rule_id)) max = Math.max(max, Number(r.rule_id));
  let id = max + 1;
  while (used.has(String(id))) id++;
  return String(id);
}

export interface RuleFormHandle {
  el: HTMLFormElement;
  focus(): void;
}

export function createRuleForm(opts: {
  initial: Rule | null;
  supportChangePort: boolean | null;
  onDone: (fields: Pick<Rule, 'enable' | 'router_protocol' | 'router_port' | 'ds_port'>) => void;
  onCancel: () => void;
}): RuleFormHandle {
  const r = opts.initial;
  const enable = h('input', { type: 'checkbox', id: 'rf-enable', checked: r ? r.enable : true });
  const initialProtocol = r ? r.router_protocol.toLowerCase() : 'tcp';
  const protocol = h(
    'select',
    { id: 'rf-protocol' },
    PROTOCOLS.map((p) => h('option', { value: p }, p === 'both' ? 'TCP and UDP' : p.toUpperCase())),
  );
  protocol.value = (PROTOCOLS as readonly string[]).includes(initialProtocol) ? initialProtocol : 'tcp';
  const routerPort = h('input', { id: 'rf-router-port', value: r?.router_port ?? '', placeholder: 'e.g. 8080 or 8000-8010', autocomplete: 'off' });
  const localPort = h('input', {
    id: 'rf-local-port',
    value: r?.ds_port ?? '',
    placeholder: opts.supportChangePort === false ? 'same as router port' : 'empty: same as router port',
    autocomplete: 'off',
  });
  if (opts.supportChangePort === false) {
    localPort.disabled = true;
    routerPort.addEventListener('input', () => {
      localPort.value = routerPort.value;
    });
  }
  const error = h('p', { class: 'field-error', role: 'alert' });
  error.hidden = true;

  const field = (name: string, label: string, control: HTMLElement) =>
    h('div', { class: 'field', dataset: { field: name } }, h('label', { for: control.id }, label), control);

  const el = h(
    'form',
    { class: 'rule-form', novalidate: true },
    h('h4', null, r ? 'Edit rule' : 'New rule'),
    h('div', { class: 'field inline' }, enable, h('label', { for: 'rf-enable' }, 'Enabled')),
    field('protocol', 'Protocol', protocol),
    field('routerPort', 'Router port(s)', routerPort),
    field('localPort', 'Local port(s)', localPort),
    h('p', { class: 'hint' }, 'Ports: single ports (80), ranges (8000-8010) or open ranges (9000-, up to 65535), separated by commas.'),
    error,
    h(
      'div',
      { class: 'actions' },
      h('button', { type: 'submit', class: 'primary' }, r ? 'Apply' : 'Add'),
      h('button', { type: 'button', onclick: () => opts.onCancel() }, 'Cancel'),
    ),
  );

  el.addEventListener('submit', (ev) => {
    ev.preventDefault();
    for (const f of el.querySelectorAll('.field')) f.classList.remove('invalid');
    const check = validateRule(
      { enable: enable.checked, protocol: protocol.value, routerPort: routerPort.value, localPort: localPort.value },
      opts.supportChangePort,
    );
    if (!check.ok) {
      el.querySelector(`[data-field="${check.field}"]`)?.classList.add('invalid');
      error.textContent = check.error;
      error.hidden = false;
      return;
    }
    error.hidden = true;
    opts.onDone(check.fields);
  });

  return { el, focus: () => routerPort.focus() };
}
