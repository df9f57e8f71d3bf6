import { describe, expect, it, vi } from 'vitest';
import type { CompatStatus, ServiceStatus } from '../src/api/portforward';
import { compatStateText, renderCompatItems } from '../src/screens/compat';
import { saveProgressText } from '../src/screens/saveProgress';
import { renderServiceTable } from '../src/screens/services';
import { renderResultList, testProgress } from '../src/screens/test';

describe('save progress', () => {
  it.each([
    [{ status: 'processing', percentage: 1 }, 1, 'Preparing the rules'],
    [{ status: 'processing', percentage: 5 }, 5, 'Sending the rules to the router'],
    [{ status: 'processing', percentage: 25, stage: 'del' }, 25, 'Removing the old mappings from the router'],
    [{ status: 'processing', percentage: 75, stage: 'add' }, 75, 'Adding the new mappings to the router'],
    [{ status: 'success', percentage: 100 }, 100, 'Saved and applied on the router'],
  ])('reads %j', (s, percentage, text) => {
    expect(saveProgressText(s)).toEqual({ percentage, text });
  });
});

describe('test progress', () => {
  it('waits without a share before results come', () => {
    expect(testProgress({ status: 'wait' })).toEqual({ percentage: null, text: 'Preparing the test' });
  });
  it('counts results that came in', () => {
    expect(testProgress({ status: 'update', rules: { '0': 'ok', '1': 'testing', '2': 'fail', '3': 'testing' } })).toEqual({
      percentage: 50,
      text: 'Testing: 2 of 4',
    });
  });
  it('ends at 100', () => {
    expect(testProgress({ status: 'success', rules: { '0': 'ok' } })).toEqual({ percentage: 100, text: 'Test finished: 1 result' });
  });
  it('lists results of service rules by their key', () => {
    const t = renderResultList({ 'web.tcp': 'ok', 'web.udp': 'testing' });
    expect([...t.querySelectorAll('tbody tr')].map((r) => r.textContent)).toEqual(['web.tcpok', 'web.udpTesting…']);
  });
});

describe('service table', () => {
  // A Rules.Serv "check" answer.
  const list: ServiceStatus[] = [
    { service_id: 'ftp', status: 'deny', port_info: { ftp: 'allow', ftp_pasv: 'deny' } },
    { service_id: 'web', status: 'allow', port_info: { http: 'allow' } },
    { service_id: 'odd', status: 'unknown' },
  ];

  it('shows each service with its status and sections', () => {
    const t = renderServiceTable(list);
    const rows = [...t.querySelectorAll('tbody tr')] as HTMLElement[];
    expect(rows.map((r) => r.dataset.serviceId)).toEqual(['ftp', 'web', 'odd']);
    expect(rows.map((r) => r.querySelector('.svc-status')!.textContent)).toEqual(['Not forwarded', 'Forwarded', 'Unknown']);
    expect([...rows[0]!.querySelectorAll('.sections li')].map((li) => li.textContent)).toEqual([
      'ftp: Forwarded',
      'ftp_pasv: Not forwarded',
    ]);
    expect(rows[2]!.querySelector('.sections')!.textContent).toMatch(/could not be determined/);
  });

  it('offers to open only services not forwarded, and to close any', () => {
    const onOpen = vi.fn();
    const onClose = vi.fn();
    const rows = [...renderServiceTable(list, { onOpen, onClose }).querySelectorAll('tbody tr')];
    expect(rows.map((r) => [...r.querySelectorAll('button')].map((b) => b.textContent))).toEqual([
      ['Open ports', 'Close ports'],
      ['Close ports'],
      ['Open ports', 'Close ports'],
    ]);
    (rows[0]!.querySelector('button') as HTMLButtonElement).click();
    expect(onOpen).toHaveBeenCalledWith('ftp');
  });
});

describe('compatibility items', () => {
  // "upnp_add" finished, "upnp_max" 12, nothing else yet.
  const midway: CompatStatus = {
    status: 'processing',
    percentage: 36,
    test: [
      { test_item: 'add', status: 'success' },
      { test_item: 'max', status: '12' },
      { test_item: 'del', status: 'processing' },
      { test_item: 'readd', status: 'unknown' },
      { test_item: 'con_s', status: 'unknown' },
    ],
  };

  const states = (s: CompatStatus | null) =>
    [...renderCompatItems(s).querySelectorAll('li')].map((li) => li.querySelector('.state')!.textContent);

  it('shows the five items in order with their states', () => {
    const ol = renderCompatItems(midway);
    expect([...ol.querySelectorAll('li')].map((li) => (li as HTMLElement).dataset.item)).toEqual(['add', 'max', 'del', 'readd', 'con_s']);
    expect(states(midway)).toEqual(['Passed', 'Passed: the router took 12 mappings', 'Testing…', 'Waiting', 'Waiting']);
  });

  it('shows items after a failure as not reached', () => {
    const failed: CompatStatus = { status: 'failed', percentage: -1, test: [{ test_item: 'add', status: 'failed' }] };
    expect(states(failed)).toEqual(['Failed', 'Not reached', 'Not reached', 'Not reached', 'Not reached']);
  });

  it('shows "not started" before a run', () => {
    expect(states(null)).toEqual(Array(5).fill('Not started'));
  });

  it('reads states without regard to case and passes other texts through', () => {
    expect(compatStateText('add', 'NOT_TEST')).toEqual({ cls: 'not_test', text: 'Not tested' });
    expect(compatStateText('readd', 'partial')).toEqual({ cls: 'other', text: 'partial' });
  });
});
