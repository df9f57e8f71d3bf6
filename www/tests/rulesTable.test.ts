import { describe, expect, it, vi } from 'vitest';
import type { Rule } from '../src/api/portforward';
import { renderRulesTable } from '../src/screens/rulesTable';

// A "load" answer of the Rules API.
const loaded: Rule[] = [
  { enable: true, rule_id: '0', router_protocol: 'tcp', router_port: '8080', ds_port: '80', serviceid: '', service_name: '' },
  { enable: false, rule_id: '1', router_protocol: 'udp', router_port: '5000-5010', ds_port: '5000-5010', serviceid: 'media', service_name: 'Media server' },
  { enable: true, rule_id: '2', router_protocol: 'both', router_port: '9000-', ds_port: '9000-', serviceid: 'sync', service_name: '' },
];

const cells = (tr: Element) => [...tr.querySelectorAll('td')].map((td) => td.textContent);

describe('rules table', () => {
  it('shows one row per rule with protocol, ports and service', () => {
    const t = renderRulesTable(loaded);
    expect([...t.querySelectorAll('th')].map((th) => th.textContent)).toEqual([
      'Enabled',
      'Protocol',
      'Router port',
      'Local port',
      'Service',
    ]);
    const rows = [...t.querySelectorAll('tbody tr')];
    expect(rows.map(cells)).toEqual([
      ['Yes', 'TCP', '8080', '80', '—'],
      ['No', 'UDP', '5000-5010', '5000-5010', 'Media server'],
      ['Yes', 'TCP and UDP', '9000-', '9000-', 'sync'],
    ]);
    expect(rows.map((r) => (r as HTMLElement).dataset.ruleId)).toEqual(['0', '1', '2']);
    expect(rows[1]!.classList.contains('rule-off')).toBe(true);
  });

  it('says so when there is no rule', () => {
    const t = renderRulesTable([]);
    expect(t.querySelectorAll('tbody tr')).toHaveLength(1);
    expect(t.querySelector('tbody td')!.textContent).toBe('No rules.');
    expect(t.querySelector('tbody td')!.getAttribute('colspan')).toBe('5');
  });

  it('offers toggle, edit and delete per rule', () => {
    const onToggle = vi.fn();
    const onEdit = vi.fn();
    const onDelete = vi.fn();
    const t = renderRulesTable(loaded, { onToggle, onEdit, onDelete });
    const rows = [...t.querySelectorAll('tbody tr')];
    const box = rows[1]!.querySelector('input[type=checkbox]') as HTMLInputElement;
    expect(box.checked).toBe(false);
    expect((rows[0]!.querySelector('input[type=checkbox]') as HTMLInputElement).checked).toBe(true);
    box.checked = true;
    box.dispatchEvent(new Event('change'));
    expect(onToggle).toHaveBeenCalledWith(1, true);
    const buttons = [...rows[2]!.querySelectorAll('button')];
    expect(buttons.map((b) => b.textContent)).toEqual(['Edit', 'Delete']);
    buttons[0]!.click();
    buttons[1]!.click();
    expect(onEdit).toHaveBeenCalledWith(2);
    expect(onDelete).toHaveBeenCalledWith(2);
  });

  it('disables the controls while a save runs', () => {
    const t = renderRulesTable(loaded, { onEdit: vi.fn(), onToggle: vi.fn(), disabled: true });
    expect([...t.querySelectorAll('button, input')].every((c) => (c as HTMLButtonElement).disabled)).toBe(true);
  });

  it('adds a result column from test results by rule id', () => {
    const t = renderRulesTable(loaded, { results: { '0': 'ok', '2': 'Testing…' } });
    expect([...t.querySelectorAll('tbody tr')].map((r) => r.querySelector('td.result')!.textContent)).toEqual([
      'ok',
      'not tested',
      'Testing…',
    ]);
  });
});
