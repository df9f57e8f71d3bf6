// Services screen: which services of the server the router forwards, per
// service and per firewall section, and opening or closing a service's
// ports (a rule save with a service policy: services win over user rules).

import { checkServices, savePolicy, type PfPolicy, type ServiceStatus } from '../api/portforward';
import type { AppContext, Screen } from '../context';
import { h, replaceChildren } from '../dom';
import { runExclusive } from '../jobs';
import { createNotice } from '../ui/notice';
import { createProgress } from '../ui/progress';
import { SAVE_POLL, saveProgressText } from './saveProgress';

export const SERVICE_STATUS_TEXT: Record<string, string> = {
  allow: 'Forwarded',
  deny: 'Not forwarded',
  unknown: 'Unknown',
};

export function serviceStatusText(s: string): string {
  return SERVICE_STATUS_TEXT[s] ?? s;
}

export interface ServiceTableOptions {
  selected?: Set<string>;
  onSelect?: (id: string, on: boolean) => void;
  onOpen?: (id: string) => void;
  onClose?: (id: string) => void;
  disabled?: boolean;
}

export function renderServiceTable(list: ServiceStatus[], opts: ServiceTableOptions = {}): HTMLTableElement {
  const actions = !!(opts.onOpen || opts.onClose);
  return h(
    'table',
    { class: 'services' },
    h(
      'thead',
      null,
      h(
        'tr',
        null,
        opts.onSelect ? h('th', { scope: 'col' }, h('span', { class: 'sr-only' }, 'Select')) : null,
        h('th', { scope: 'col' }, 'Service'),
        h('th', { scope: 'col' }, 'Status'),
        h('th', { scope: 'col' }, 'Firewall sections'),
        actions ? h('th', { scope: 'col' }, h('span', { class: 'sr-only' }, 'Actions')) : null,
      ),
    ),
    h(
      'tbody',
      null,
      list.length === 0
        ? h('tr', { class: 'empty' }, h('td', { colspan: '5' }, 'No services.'))
        : list.map((s) =>
            h(
              'tr',
              { dataset: { serviceId: s.service_id, status: s.status } },
              opts.onSelect
                ? h(
                    'td',
                    null,
                    h('input', {
                      type: 'checkbox',
                      'aria-label': `Select ${s.service_id}`,
                      checked: opts.selected?.has(s.service_id) ?? false,
                      disabled: opts.disabled,
                      onchange: (ev: Event) => opts.onSelect?.(s.service_id, (ev.target as HTMLInputElement).checked),
                    }),
                  )
                : null,
              h('td', null, s.service_id),
              h('td', { class: `svc-status svc-${s.status}` }, serviceStatusText(s.status)),
              h(
                'td',
                { class: 'sections' },
                s.port_info && Object.keys(s.port_info).length > 0
                  ? h(
                      'ul',
                      null,
                      Object.entries(s.port_info).map(([name, v]) =>
                        h('li', { class: `svc-${v}` }, `${name}: ${serviceStatusText(v)}`),
                      ),
                    )
                  : s.status === 'unknown'
                    ? 'The service’s firewall sections could not be determined.'
                    : '—',
              ),
              actions
                ? h(
                    'td',
                    { class: 'row-actions' },
                    opts.onOpen && s.status !== 'allow'
                      ? h('button', { type: 'button', disabled: opts.disabled, onclick: () => opts.onOpen?.(s.service_id) }, 'Open ports')
                      : null,
                    opts.onClose
                      ? h('button', { type: 'button', class: 'danger', disabled: opts.disabled, onclick: () => opts.onClose?.(s.service_id) }, 'Close ports')
                      : null,
                  )
                : null,
            ),
          ),
    ),
  );
}

export function createServicesScreen(ctx: AppContext): Screen {
  const { client, jobs } = ctx;
  const notice = createNotice();
  const progress = createProgress('Applying progress');
  const tableBox = h('div', { class: 'services-box' });
  const checkButton = h('button', { type: 'button' }, 'Check again');
  const openSelected = h('button', { type: 'button', class: 'primary' }, 'Open ports of selected');
  const closeSelected = h('button', { type: 'button', class: 'danger' }, 'Close ports of selected');

  let list: ServiceStatus[] = [];
  const selected = new Set<string>();
  let checked = false;
  let busy = false;

  const render = () => {
    replaceChildren(
      tableBox,
      renderServiceTable(list, {
        selected,
        disabled: busy,
        onSelect: (id, on) => {
          if (on) selected.add(id);
          else selected.delete(id);
          render();
        },
        onOpen: (id) => void apply({ add: [id] }, `Opening the ports of ${id}`),
        onClose: (id) => void apply({ remove: [id] }, `Closing the ports of ${id}`),
      }),
    );
    checkButton.disabled = busy;
    openSelected.disabled = busy || selected.size === 0;
    closeSelected.disabled = busy || selected.size === 0;
  };

  async function check(): Promise<boolean> {
    replaceChildren(tableBox, h('p', { class: 'loading' }, 'Checking the services…'));
    try {
      const a = await checkServices(client);
      list = Array.isArray(a?.service_status) ? a.service_status : [];
      for (const id of [...selected]) if (!list.some((s) => s.service_id === id)) selected.delete(id);
      checked = true;
      render();
      return true;
    } catch (e) {
      notice.error(e, 'services');
      list = [];
      render();
      return false;
    }
  }

  async function apply(policy: PfPolicy, what: string): Promise<void> {
    notice.clear();
    busy = true;
    render();
    progress.set(0, what);
    try {
      await runExclusive(client, jobs, what.toLowerCase(), () =>
        savePolicy(client, policy, {
          ...SAVE_POLL,
          signal: ctx.signal,
          onUpdate: (s) => {
            const p = saveProgressText(s);
            progress.set(p.percentage, `${what}: ${p.text.toLowerCase()}`);
          },
        }),
      );
      progress.set(100, `${what}: done`);
      selected.clear();
      busy = false;
      if (await check()) notice.success(`${what}: done. The table shows the new state.`);
    } catch (e) {
      progress.hide();
      notice.error(e, 'save');
    } finally {
      busy = false;
      render();
    }
  }

  checkButton.addEventListener('click', () => {
    notice.clear();
    void check();
  });
  openSelected.addEventListener('click', () =>
    void apply({ add: [...selected] }, `Opening the ports of ${selected.size} service${selected.size > 1 ? 's' : ''}`),
  );
  closeSelected.addEventListener('click', () =>
    void apply({ remove: [...selected] }, `Closing the ports of ${selected.size} service${selected.size > 1 ? 's' : ''}`),
  );

  const el = h(
    'section',
    { class: 'screen', id: 'screen-services', 'aria-labelledby': 'services-title' },
    h('h2', { id: 'services-title' }, 'Services'),
    h(
      'section',
      { class: 'card' },
      h(
        'p',
        { class: 'hint' },
        'A service is forwarded when every port of each of its firewall sections is covered by an enabled rule. Opening a service’s ports takes them out of other rules and adds rules of its own; closing removes its ports from all rules.',
      ),
      notice.el,
      tableBox,
      h('div', { class: 'actions' }, openSelected, closeSelected, checkButton),
      progress.el,
    ),
  );
  render();

  return {
    id: 'services',
    title: 'Services',
    el,
    enter() {
      if (!checked && !busy) void check();
    },
  };
}
