import { describe, expect, it } from 'vitest';
import type { DetectAnswer } from '../src/api/portforward';
import {
  detectionSummary,
  failedStep,
  finishedSteps,
  hasRouter,
  renderChecklist,
  renderDetection,
} from '../src/screens/detectionView';

// detect_status while the hops check runs (stage 70), gateway with a warning.
const running: DetectAnswer = {
  status: 'processing',
  percentage: 70,
  progress: {
    check_interface_enable_step: { check_id: 1, status: 'success', network_interface: 'eth0' },
    check_gateway_setting_step: { check_id: 2, status: 'warning', gateway_ip: '192.168.1.1' },
    check_connect_wan_step: { check_id: 3, status: 'success' },
    check_hops_lan2wan_step: { check_id: 4, status: 'processing' },
    check_dns_setting_step: { check_id: 5, status: 'initial' },
    detect_router_step: { check_id: 6, status: 'initial' },
  },
};

// A run that stopped at the DNS check (stage 50): hops finished with a count.
const stoppedAtDns: DetectAnswer = {
  status: 'success',
  percentage: 100,
  progress: {
    check_interface_enable_step: { status: 'success', network_interface: 'eth1' },
    check_gateway_setting_step: { status: 'success', gateway_ip: '10.0.0.1' },
    check_connect_wan_step: { status: 'success' },
    check_hops_lan2wan_step: { status: 'warning', warning_type: 'hops_over_one', hops_number: 3 },
    check_dns_setting_step: { status: 'failed' },
    detect_router_step: { status: 'stop' },
  },
};

// A finished run that found a router.
const found: DetectAnswer = {
  status: 'success',
  percentage: 100,
  support_natpmp: 'no',
  support_upnp: 'yes',
  router_brand: 'Acme',
  router_model: 'RT-100',
  router_version: '2.1',
  upnp_pfpath: 'Acme: RT-100 (2.1)',
  router_user_setting_name: '',
  router_max_rule: 32,
  progress: {
    check_interface_enable_step: { status: 'success', network_interface: 'eth0' },
    check_gateway_setting_step: { status: 'success', gateway_ip: '192.168.1.1' },
    check_connect_wan_step: { status: 'success' },
    check_hops_lan2wan_step: { status: 'warning', warning_type: 'get_hops_fail', hops_number: 0 },
    check_dns_setting_step: { status: 'success' },
    detect_router_step: { status: 'success' },
  },
};

const rows = (el: HTMLElement) => [...el.querySelectorAll('li.step')] as HTMLElement[];
const text = (el: Element | null | undefined) => el?.textContent ?? '';

describe('detection checklist', () => {
  it('shows the six steps in order with their states while running', () => {
    const list = renderChecklist(running);
    const r = rows(list);
    expect(r.map((x) => x.dataset.step)).toEqual([
      'check_interface_enable_step',
      'check_gateway_setting_step',
      'check_connect_wan_step',
      'check_hops_lan2wan_step',
      'check_dns_setting_step',
      'detect_router_step',
    ]);
    expect(r.map((x) => x.dataset.status)).toEqual(['success', 'warning', 'success', 'processing', 'initial', 'initial']);
    expect(r.map((x) => text(x.querySelector('.state')))).toEqual([
      'Passed',
      'Passed with a warning',
      'Passed',
      'Checking…',
      'Waiting',
      'Waiting',
    ]);
  });

  it('shows the interface, the gateway address and the gateway warning', () => {
    const r = rows(renderChecklist(running));
    expect(text(r[0]!.querySelector('.details'))).toBe('Interface: eth0');
    expect(text(r[1]!.querySelector('.details'))).toBe('Gateway: 192.168.1.1');
    expect(text(r[1]!.querySelector('.warning'))).toMatch(/gateway setting looks unusual/);
    expect(r[2]!.querySelector('.warning')).toBeNull();
  });

  it('shows the hop count with "hops_over_one", the failed step with advice, and unreached steps', () => {
    const r = rows(renderChecklist(stoppedAtDns));
    expect(text(r[3]!.querySelector('.details'))).toBe('Hops: 3');
    expect(text(r[3]!.querySelector('.warning'))).toMatch(/more than one router/);
    expect(r[4]!.dataset.status).toBe('failed');
    expect(text(r[4]!.querySelector('.state'))).toBe('Failed');
    expect(text(r[4]!.querySelector('.advice'))).toMatch(/DNS server/);
    expect(text(r[5]!.querySelector('.state'))).toBe('Not reached');
  });

  it('shows the "get_hops_fail" warning', () => {
    const r = rows(renderChecklist(found));
    expect(text(r[3]!.querySelector('.warning'))).toBe('The number of hops to the internet could not be found.');
  });

  it('shows all steps waiting before the first report', () => {
    const r = rows(renderChecklist({ status: 'processing', percentage: 10, progress: null }));
    expect(r.map((x) => x.dataset.status)).toEqual(Array(6).fill('initial'));
    expect(rows(renderChecklist(null))).toHaveLength(6);
  });

  it('does not turn a server text into markup', () => {
    const a: DetectAnswer = {
      status: 'processing',
      percentage: 20,
      progress: { check_interface_enable_step: { status: 'success', network_interface: '<img src=x onerror=alert(1)>' } },
    };
    const list = renderChecklist(a);
    expect(list.querySelector('img')).toBeNull();
    expect(text(list)).toContain('<img src=x onerror=alert(1)>');
  });
});

describe('detection outcome', () => {
  it('counts finished steps and names the current one', () => {
    expect(finishedSteps(running)).toBe(3);
    expect(detectionSummary(running)).toEqual({
      kind: 'running',
      text: 'Step 4 of 6: Hops from the local network to the internet',
    });
  });

  it('takes a finished run with a failed step as stopped', () => {
    expect(failedStep(stoppedAtDns)).toBe('check_dns_setting_step');
    expect(detectionSummary(stoppedAtDns)).toEqual({ kind: 'failed', text: 'Detection stopped at: DNS server is set.' });
    expect(hasRouter(stoppedAtDns)).toBe(false);
    expect(renderDetection(stoppedAtDns).querySelector('.router-found')).toBeNull();
  });

  it('shows the detected router of a finished run', () => {
    expect(hasRouter(found)).toBe(true);
    expect(detectionSummary(found).text).toBe('Detection finished with 1 warning: read them below.');
    const dl = renderDetection(found).querySelector('.router-found')!;
    const pairs = [...dl.querySelectorAll('.kv')].map((kv) => [text(kv.querySelector('dt')), text(kv.querySelector('dd'))]);
    expect(pairs).toEqual([
      ['Brand', 'Acme'],
      ['Model', 'RT-100'],
      ['Version', '2.1'],
      ['UPnP', 'Yes'],
      ['NAT-PMP', 'No'],
      ['Name over UPnP', 'Acme: RT-100 (2.1)'],
      ['Configuration in use', '—'],
      ['Maximum rules', '32'],
    ]);
  });

  it('says when no run was made yet', () => {
    expect(detectionSummary(null)).toEqual({ kind: 'idle', text: 'Detection has not run on this page yet.' });
    expect(detectionSummary({ status: 'processing', percentage: 10, progress: null })).toEqual({
      kind: 'running',
      text: 'Starting (0 of 6 steps done)',
    });
  });

  it('takes the final status word without regard to case', () => {
    expect(detectionSummary({ ...found, status: 'SUCCESS' }).kind).toBe('done');
    expect(detectionSummary({ status: 'Failed', percentage: 100, progress: null })).toEqual({
      kind: 'failed',
      text: 'Detection failed.',
    });
  });
});
