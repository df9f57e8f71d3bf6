import { describe, expect, it } from 'vitest';
import type { Rule } from '../src/api/portforward';
import { nextRuleId, validateRule } from '../src/screens/ruleForm';
import { buildRouterConfInput, modeOf, type RouterConfValues } from '../src/screens/routerConfForm';

describe('validateRule', () => {
  const draft = { enable: true, protocol: 'tcp', routerPort: '8080', localPort: '80' };

  it('accepts a rule and sends normalised port texts', () => {
    expect(validateRule({ ...draft, routerPort: ' 8080 ', localPort: '080' }, true)).toEqual({
      ok: true,
      fields: { enable: true, router_protocol: 'tcp', router_port: '8080', ds_port: '80' },
    });
  });

  it('takes an empty local port as the router port', () => {
    const r = validateRule({ ...draft, routerPort: '8000-8010', localPort: '' }, false);
    expect(r.ok && r.fields.ds_port).toBe('8000-8010');
  });

  it('names the field with bad syntax', () => {
    expect(validateRule({ ...draft, routerPort: '80-' + '70' }, true)).toMatchObject({ ok: false, field: 'routerPort' });
    expect(validateRule({ ...draft, localPort: '99999' }, true)).toMatchObject({
      ok: false,
      field: 'localPort',
      error: 'Local port: Port 99999 is above 65535.',
    });
  });

  it('refuses an unknown protocol', () => {
    expect(validateRule({ ...draft, protocol: 'sctp' }, true)).toMatchObject({ ok: false, field: 'protocol' });
  });

  it('refuses different local ports when the router cannot change ports', () => {
    expect(validateRule(draft, false)).toMatchObject({ ok: false, field: 'localPort', error: /cannot forward to a different local port/ });
    expect(validateRule({ ...draft, localPort: '8080' }, false).ok).toBe(true);
  });

  it('allows different local ports when unknown or supported', () => {
    expect(validateRule(draft, null).ok).toBe(true);
    expect(validateRule(draft, true).ok).toBe(true);
  });

  it('refuses router and local ports of different sizes', () => {
    expect(validateRule({ ...draft, routerPort: '8000-8010', localPort: '80-85' }, true)).toMatchObject({
      ok: false,
      error: 'The router ports and the local ports must cover as many ports each (router: 11, local: 6).',
    });
    expect(validateRule({ ...draft, routerPort: '8000-8005', localPort: '80-85' }, true).ok).toBe(true);
    // Open ranges are left to the router.
    expect(validateRule({ ...draft, routerPort: '9000-', localPort: '80-85' }, true).ok).toBe(true);
  });
});

describe('nextRuleId', () => {
  const r = (rule_id: string): Rule => ({
    rule_id,
    enable: true,
    router_protocol: 'tcp',
    router_port: '1',
    ds_port: '1',
    serviceid: '',
    service_name: '',
  });
  it('takes the number after the highest numeric id', () => {
    expect(nextRuleId([])).toBe('0');
    expect(nextRuleId([r('0'), r('7'), r('svc.tcp'), r('3')])).toBe('8');
  });
});

describe('buildRouterConfInput', () => {
  const v: RouterConfValues = {
    brand: ' Acme ',
    model: 'RT-100',
    version: '2.1',
    mode: 'pages',
    protocol: 'https',
    port: '8443',
    account: 'admin',
    password: ' secret ',
  };

  it('sends UPnP with the pages protocol and port but without a login', () => {
    expect(buildRouterConfInput({ ...v, mode: 'upnp' })).toEqual({
      ok: true,
      input: {
        router_brand: 'Acme',
        router_model: 'RT-100',
        router_version: '2.1',
        support_upnp: 'yes',
        support_natpmp: 'no',
        router_protocol: 'https',
        router_port: 8443,
      },
    });
  });

  it('sends UPnP with HTTP on port 80 when the pages fields are empty or wrong', () => {
    const r = buildRouterConfInput({ ...v, mode: 'upnp', protocol: '', port: 'x' });
    expect(r.ok && r.input).toMatchObject({ router_protocol: 'http', router_port: 80 });
  });

  it('sends NAT-PMP without page settings or login', () => {
    const r = buildRouterConfInput({ ...v, mode: 'natpmp' });
    expect(r.ok && r.input).toMatchObject({ support_upnp: 'no', support_natpmp: 'yes' });
    expect(r.ok && 'router_pass' in r.input).toBe(false);
  });

  it('sends the pages settings with the port as an integer and the password as typed', () => {
    expect(buildRouterConfInput(v)).toEqual({
      ok: true,
      input: {
        router_brand: 'Acme',
        router_model: 'RT-100',
        router_version: '2.1',
        support_upnp: 'no',
        support_natpmp: 'no',
        router_protocol: 'https',
        router_port: 8443,
        router_account: 'admin',
        router_pass: ' secret ',
      },
    });
  });

  it('leaves account and password out when there is no account', () => {
    const r = buildRouterConfInput({ ...v, account: ' ' });
    expect(r.ok && 'router_account' in r.input).toBe(false);
    expect(r.ok && 'router_pass' in r.input).toBe(false);
  });

  it.each([
    [{ port: '0' }, 'port'],
    [{ port: '65536' }, 'port'],
    [{ port: '80a' }, 'port'],
    [{ protocol: '' }, 'protocol'],
    [{ brand: '' }, 'brand'],
    [{ model: '' }, 'model'],
  ] as [Partial<RouterConfValues>, string][])('refuses pages settings %j', (change, field) => {
    expect(buildRouterConfInput({ ...v, ...change })).toMatchObject({ ok: false, field });
  });

  it('reads the mode of a stored configuration', () => {
    expect(modeOf({ support_upnp: 'yes', support_natpmp: 'no' })).toBe('upnp');
    expect(modeOf({ support_upnp: 'no', support_natpmp: 'yes' })).toBe('natpmp');
    expect(modeOf({ support_upnp: 'no', support_natpmp: 'no' })).toBe('pages');
    expect(modeOf({ support_upnp: '', support_natpmp: '' })).toBe('pages');
  });
});
