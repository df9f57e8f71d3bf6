// Renders port-forwarding rules as a table: enabled, protocol, router port,
// local port, service, and either the edit actions or a test result column.

import type { Rule } from '../api/portforward';
import { h } from '../dom';

export const PROTOCOL_TEXT: Record<string, string> = { tcp: 'TCP', udp: 'UDP', both: 'TCP and UDP' };

export function protocolText(p: string): string {
  return PROTOCOL_TEXT[p.toLowerCase()] ?? (p === '' ? '—' : p);
}

export function serviceText(r: Pick<Rule, 'service_name' | 'serviceid'>): string {
  return r.service_name || r.serviceid || '—';
}

export interface RulesTableOptions {
  onToggle?: (index: number, enabled: boolean) => void;
  onEdit?: (index: number) => void;
  onDelete?: (index: number) => void;
  // Test results by rule id; adds a "Result" column.
  results?: Record<string, string>;
  disabled?: boolean;
}

export function renderRulesTable(rules: Rule[], opts: RulesTableOptions = {}): HTMLTableElement {
  const editable = !!(opts.onEdit || opts.onDelete || opts.onToggle);
  const withResults = opts.results !== undefined;
  const cols = 5 + (withResults ? 1 : 0) + (editable ? 1 : 0);
  return h(
    'table',
    { class: 'rules' },
    h(
      'thead',
      null,
      h(
        'tr',
        null,
        h('th', { scope: 'col' }, 'Enabled'),
        h('th', { scope: 'col' }, 'Protocol'),
        h('th', { scope: 'col' }, 'Router port'),
        h('th', { scope: 'col' }, 'Local port'),
        h('th', { scope: 'col' }, 'Service'),
        withResults ? h('th', { scope: 'col' }, 'Result') : null,
        editable ? h('th', { scope: 'col' }, h('span', { class: 'sr-only' }, 'Actions')) : null,
      ),
    ),
    h(
      'tbody',
      null,
      rules.length === 0
        ? h('tr', { class: 'empty' }, h('td', { colspan: String(cols) }, 'No rules.'))
        : rules.map((r, i) => {
            const result = withResults ? opts.results?.[r.rule_id] : undefined;
            return h(
              'tr',
              { dataset: { ruleId: r.rule_id }, class: r.enable ? 'rule' : 'rule rule-off' },
              h(
                'td',
                null,
                opts.onToggle
                  ? h('input', {
                      type: 'checkbox',
                      checked: r.enable,
                      disabled: opts.disabled,
                      'aria-label': `Rule ${r.router_port} enabled`,
                      onchange: (ev: Event) => opts.onToggle?.(i, (ev.target as HTMLInputElement).checked),
                    })
                  : r.enable
                    ? 'Yes'
                    : 'No',
              ),
              h('td', null, protocolText(r.router_protocol)),
              h('td', { class: 'ports' }, r.router_port),
              h('td', { class: 'ports' }, r.ds_port),
              h('td', null, serviceText(r)),
              withResults ? h('td', { class: 'result' }, result ?? 'not tested') : null,
              editable
                ? h(
                    'td',
                    { class: 'row-actions' },
                    opts.onEdit
                      ? h('button', { type: 'button', disabled: opts.disabled, onclick: () => opts.onEdit?.(i) }, 'Edit')
                      : null,
                    opts.onDelete
                      ? h('button', { type: 'button', class: 'danger', disabled: opts.disabled, onclick: () => opts.onDelete?.(i) }, 'Delete')
                      : null,
                  )
                : null,
            );
          }),
    ),
  );
}
