// The router configuration form: how the server talks to its router.
//
// Three ways: UPnP, NAT-PMP, or the router's own administration pages (then
// with protocol, port, account and password). The stored password is never
// shown back: the password field always starts empty and must be entered
// again on every save, because each save stores the whole configuration.

import type { RouterConf, RouterConfInput } from '../api/portforward';
import { h } from '../dom';

export type RouterMode = 'upnp' | 'natpmp' | 'pages';

export interface RouterConfValues {
  brand: string;
  model: string;
  version: string;
  mode: RouterMode;
  protocol: string;
  port: string;
  account: string;
  password: string;
}

export type RouterConfCheck =
  | { ok: true; input: RouterConfInput }
  | { ok: false; field: keyof RouterConfValues; error: string };

export function buildRouterConfInput(v: RouterConfValues): RouterConfCheck {
  const base = {
    router_brand: v.brand.trim(),
    router_model: v.model.trim(),
    router_version: v.version.trim(),
  };
  // A router driven by UPnP or NAT-PMP needs no page access of its own, but
  // storing it after a detection also stores the detected router under its
  // own name, and that configuration needs a way to its pages: the pages'
  // protocol and port go along (HTTP on 80 unless the form says otherwise).
  if (v.mode === 'upnp' || v.mode === 'natpmp') {
    const protocol = v.protocol.trim() || 'http';
    const portText = v.port.trim();
    const port = /^\d{1,5}$/.test(portText) && Number(portText) >= 1 && Number(portText) <= 65535 ? Number(portText) : 80;
    return {
      ok: true,
      input: {
        ...base,
        support_upnp: v.mode === 'upnp' ? 'yes' : 'no',
        support_natpmp: v.mode === 'natpmp' ? 'yes' : 'no',
        router_protocol: protocol,
        router_port: port,
      },
    };
  }

  if (base.router_brand === '') return { ok: false, field: 'brand', error: 'Choose the router’s brand (from the list of known routers).' };
  if (base.router_model === '') return { ok: false, field: 'model', error: 'Choose the router’s model (from the list of known routers).' };
  const protocol = v.protocol.trim();
  if (protocol === '') return { ok: false, field: 'protocol', error: 'Choose how to reach the router’s pages (HTTP or HTTPS).' };
  const portText = v.port.trim();
  if (!/^\d{1,5}$/.test(portText) || Number(portText) < 1 || Number(portText) > 65535) {
    return { ok: false, field: 'port', error: 'Enter the port of the router’s pages, a number from 1 to 65535.' };
  }
  const input: RouterConfInput = {
    ...base,
    support_upnp: 'no',
    support_natpmp: 'no',
    router_protocol: protocol,
    router_port: Number(portText),
  };
  const account = v.account.trim();
  if (account !== '') {
    input.router_account = account;
    input.router_pass = v.password;
  }
  return { ok: true, input };
}

export function modeOf(conf: Pick<RouterConf, 'support_upnp' | 'support_natpmp'>): RouterMode {
  if (conf.support_upnp === 'yes') return 'upnp';
  if (conf.support_natpmp === 'yes') return 'natpmp';
  return 'pages';
}

export const MODE_TEXT: Record<RouterMode, string> = {
  upnp: 'UPnP',
  natpmp: 'NAT-PMP',
  pages: 'Router administration pages',
};

export interface RouterConfForm {
  el: HTMLFormElement;
  values(): RouterConfValues;
  fill(v: Partial<RouterConfValues>): void;
  showError(field: keyof RouterConfValues | null, text: string | null): void;
  clearPassword(): void;
  setBusy(busy: boolean): void;
}

export function createRouterConfForm(onSubmit: (v: RouterConfValues) => void): RouterConfForm {
  const input = (name: string, label: string, attrs: Record<string, unknown> = {}) => {
    const el = h('input', { name, id: `rc-${name}`, ...attrs });
    return { el, row: h('div', { class: 'field', dataset: { field: name } }, h('label', { for: `rc-${name}` }, label), el) };
  };
  const brand = input('brand', 'Brand', { autocomplete: 'off' });
  const model = input('model', 'Model', { autocomplete: 'off' });
  const version = input('version', 'Version', { autocomplete: 'off' });
  const port = input('port', 'Port of the pages', { type: 'number', min: '1', max: '65535', value: '80' });
  const account = input('account', 'Account on the router', { autocomplete: 'off' });
  const password = input('password', 'Password on the router', { type: 'password', autocomplete: 'new-password' });
  const protocol = h(
    'select',
    { name: 'protocol', id: 'rc-protocol' },
    h('option', { value: 'http' }, 'HTTP'),
    h('option', { value: 'https' }, 'HTTPS'),
  );
  const modeRadios = (['upnp', 'natpmp', 'pages'] as RouterMode[]).map((m) =>
    h('input', { type: 'radio', name: 'mode', value: m, id: `rc-mode-${m}`, checked: m === 'upnp' }),
  );
  const error = h('p', { class: 'field-error', role: 'alert' });
  error.hidden = true;
  const submit = h('button', { type: 'submit', class: 'primary' }, 'Save router configuration');

  const pagesBox = h(
    'fieldset',
    { class: 'pages-settings' },
    h('legend', null, 'Administration pages'),
    h('div', { class: 'field', dataset: { field: 'protocol' } }, h('label', { for: 'rc-protocol' }, 'Protocol'), protocol),
    port.row,
    account.row,
    password.row,
    h(
      'p',
      { class: 'hint' },
      'The stored password is never shown. Enter it each time you save this configuration; leave the account empty if the router has no login.',
    ),
  );

  const mode = (): RouterMode =>
    (modeRadios.find((r) => r.checked)?.value as RouterMode | undefined) ?? 'upnp';
  const syncMode = () => {
    pagesBox.hidden = mode() !== 'pages';
  };
  for (const r of modeRadios) r.addEventListener('change', syncMode);

  const el = h(
    'form',
    { class: 'router-conf-form', novalidate: true },
    h(
      'fieldset',
      { class: 'mode' },
      h('legend', null, 'How the server talks to the router'),
      modeRadios.map((r) =>
        h('label', { class: 'radio', for: r.id }, r, ` ${MODE_TEXT[r.value as RouterMode]}`),
      ),
    ),
    brand.row,
    model.row,
    version.row,
    pagesBox,
    error,
    h('div', { class: 'actions' }, submit),
  );
  syncMode();

  const values = (): RouterConfValues => ({
    brand: brand.el.value,
    model: model.el.value,
    version: version.el.value,
    mode: mode(),
    protocol: protocol.value,
    port: port.el.value,
    account: account.el.value,
    password: password.el.value,
  });

  el.addEventListener('submit', (ev) => {
    ev.preventDefault();
    onSubmit(values());
  });

  return {
    el,
    values,
    fill(v) {
      if (v.brand !== undefined) brand.el.value = v.brand;
      if (v.model !== undefined) model.el.value = v.model;
      if (v.version !== undefined) version.el.value = v.version;
      if (v.mode !== undefined) for (const r of modeRadios) r.checked = r.value === v.mode;
      if (v.protocol !== undefined && v.protocol !== '') protocol.value = v.protocol;
      if (v.port !== undefined && v.port !== '') port.el.value = v.port;
      syncMode();
    },
    showError(field, text) {
      for (const f of el.querySelectorAll('.field')) f.classList.remove('invalid');
      if (text === null) {
        error.hidden = true;
        error.textContent = '';
        return;
      }
      if (field) el.querySelector(`[data-field="${field}"]`)?.classList.add('invalid');
      error.textContent = text;
      error.hidden = false;
    },
    clearPassword() {
      password.el.value = '';
    },
    setBusy(busy) {
      submit.disabled = busy;
    },
  };
}
