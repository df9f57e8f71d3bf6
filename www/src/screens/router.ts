// Router screen: detection, the stored configuration, the list of known
// routers and the router database.

import { isApiError } from '../api/client';
import { ModuleCode } from '../api/codes';
import {
  detect,
  getRouterConf,
  listRouters,
  setRouterConf,
  updateRouterDb,
  type DetectAnswer,
  type RouterConf,
  type RouterDbEntry,
} from '../api/portforward';
import type { AppContext, Screen } from '../context';
import { h, replaceChildren } from '../dom';
import { runExclusive } from '../jobs';
import { createNotice } from '../ui/notice';
import { createProgress } from '../ui/progress';
import {
  detectionSummary,
  failedStep,
  finishedSteps,
  hasRouter,
  renderDetection,
  supportText,
} from './detectionView';
import {
  MODE_TEXT,
  buildRouterConfInput,
  createRouterConfForm,
  modeOf,
  type RouterConfValues,
} from './routerConfForm';

// Detection answers every ~500 ms; a run is given 3 minutes.
export const DETECT_POLL = { intervalMs: 500, maxPolls: 360 };
// Rows of the known-router table shown at once; the filter narrows the rest.
const ROUTER_ROWS_SHOWN = 200;

export function createRouterScreen(ctx: AppContext): Screen {
  const { client, jobs } = ctx;

  // ---- detection ----
  const detectNotice = createNotice();
  const detectProgress = createProgress('Detection progress');
  const detectView = h('div', { class: 'detect-view' }, renderDetection(null));
  const useDetected = h('button', { type: 'button' }, 'Use the detected router below');
  useDetected.hidden = true;
  let lastDetect: DetectAnswer | null = null;
  const detectButton = h('button', { type: 'button', class: 'primary' }, 'Detect router');

  const showDetect = (a: DetectAnswer) => {
    lastDetect = a;
    replaceChildren(detectView, renderDetection(a));
    const sum = detectionSummary(a);
    detectProgress.set((finishedSteps(a) / 6) * 100, sum.text);
  };

  detectButton.addEventListener('click', async () => {
    detectNotice.clear();
    useDetected.hidden = true;
    detectButton.disabled = true;
    replaceChildren(detectView, renderDetection({ status: 'processing', percentage: 0, progress: null }));
    detectProgress.set(0, 'Starting detection');
    try {
      const final = await runExclusive(client, jobs, 'router detection', () =>
        detect(client, { ...DETECT_POLL, signal: ctx.signal, onUpdate: showDetect }),
      );
      showDetect(final);
      // The summary line above the checklist tells the outcome; a stopped run
      // also points at the step that says what to check.
      if (failedStep(final) || detectionSummary(final).kind === 'failed') {
        detectNotice.warn('Detection did not complete. The failed step below says what to check.');
      }
      useDetected.hidden = !hasRouter(final);
    } catch (e) {
      detectProgress.hide();
      detectNotice.error(e, 'detect');
    } finally {
      detectButton.disabled = false;
    }
  });

  useDetected.addEventListener('click', () => {
    if (!lastDetect) return;
    form.fill({
      brand: lastDetect.router_brand ?? '',
      model: lastDetect.router_model ?? '',
      version: lastDetect.router_version ?? '',
      mode: lastDetect.support_upnp === 'yes' ? 'upnp' : lastDetect.support_natpmp === 'yes' ? 'natpmp' : 'pages',
    });
    confNotice.info('The detected router was put into the form. Check it and save the configuration.');
    form.el.scrollIntoView?.({ block: 'nearest' });
  });

  // ---- stored configuration ----
  const confNotice = createNotice();
  const confView = h('div', { class: 'conf-view' });
  const form = createRouterConfForm((v) => void saveConf(v));

  const renderConf = (c: RouterConf) => {
    const mode = modeOf(c);
    const row = (label: string, value: string) =>
      h('div', { class: 'kv' }, h('dt', null, label), h('dd', null, value === '' ? '—' : value));
    replaceChildren(
      confView,
      h(
        'dl',
        { class: 'conf' },
        row('Brand', c.router_brand),
        row('Model', c.router_model),
        row('Version', c.router_version),
        row('Talks to the router by', MODE_TEXT[mode]),
        row('UPnP', supportText(c.support_upnp)),
        row('NAT-PMP', supportText(c.support_natpmp)),
        mode === 'pages' ? row('Pages', `${c.router_protocol}, port ${c.router_port}`) : null,
        row('Maximum rules', c.router_max_rule),
      ),
    );
  };

  async function loadConf(): Promise<void> {
    replaceChildren(confView, h('p', { class: 'loading' }, 'Reading the stored configuration…'));
    try {
      const c = await getRouterConf(client);
      renderConf(c);
      form.fill({
        brand: c.router_brand,
        model: c.router_model,
        version: c.router_version,
        mode: modeOf(c),
        protocol: c.router_protocol,
        port: c.router_port,
      });
    } catch (e) {
      if (isApiError(e) && e.code === ModuleCode.Busy) {
        replaceChildren(
          confView,
          h('p', { class: 'empty' }, 'No router is configured for the current gateway yet. Detect it, or pick it from the list of known routers, then save.'),
        );
      } else {
        replaceChildren(confView);
        confNotice.error(e, 'router-conf');
      }
    }
  }

  async function saveConf(v: RouterConfValues): Promise<void> {
    confNotice.clear();
    const check = buildRouterConfInput(v);
    if (!check.ok) {
      form.showError(check.field, check.error);
      return;
    }
    form.showError(null, null);
    form.setBusy(true);
    try {
      await setRouterConf(client, check.input);
      form.clearPassword();
      confNotice.success('The router configuration was saved.');
      await loadConf();
    } catch (e) {
      confNotice.error(e, 'router-conf');
    } finally {
      form.setBusy(false);
    }
  }

  // ---- known routers ----
  const listNotice = createNotice();
  const filter = h('input', { type: 'search', placeholder: 'Filter by brand or model', 'aria-label': 'Filter known routers' });
  const listView = h('div', { class: 'router-list' });
  let routers: RouterDbEntry[] = [];
  let listLoaded = false;

  const renderList = () => {
    const q = filter.value.trim().toLowerCase();
    const shown = routers.filter(
      (r) => q === '' || `${r.router_brand} ${r.router_model} ${r.router_version}`.toLowerCase().includes(q),
    );
    replaceChildren(
      listView,
      h(
        'table',
        { class: 'routers' },
        h('thead', null, h('tr', null, h('th', null, 'Brand'), h('th', null, 'Model'), h('th', null, 'Version'), h('th', null, ''))),
        h(
          'tbody',
          null,
          shown.slice(0, ROUTER_ROWS_SHOWN).map((r) =>
            h(
              'tr',
              null,
              h('td', null, r.router_brand),
              h('td', null, r.router_model, r.generic ? h('span', { class: 'tag' }, 'generic') : null),
              h('td', null, r.router_version),
              h(
                'td',
                null,
                h(
                  'button',
                  {
                    type: 'button',
                    onclick: () => {
                      form.fill({ brand: r.router_brand, model: r.router_model, version: r.router_version, mode: 'pages' });
                      confNotice.info(`${r.router_brand} ${r.router_model} was put into the form. Fill in how to reach its pages and save.`);
                      form.el.scrollIntoView?.({ block: 'nearest' });
                    },
                  },
                  'Choose',
                ),
              ),
            ),
          ),
        ),
      ),
      h(
        'p',
        { class: 'hint' },
        shown.length > ROUTER_ROWS_SHOWN
          ? `Showing ${ROUTER_ROWS_SHOWN} of ${shown.length} matching routers; narrow the filter.`
          : `${shown.length} of ${routers.length} known routers.`,
      ),
    );
  };
  filter.addEventListener('input', renderList);

  async function loadList(): Promise<void> {
    listNotice.clear();
    replaceChildren(listView, h('p', { class: 'loading' }, 'Reading the router database…'));
    try {
      const answer = await listRouters(client);
      routers = Array.isArray(answer?.routers) ? answer.routers : [];
      listLoaded = true;
      renderList();
    } catch (e) {
      replaceChildren(listView);
      listNotice.error(e, 'router-list');
    }
  }

  // ---- router database ----
  const dbNotice = createNotice();
  const dbButton = h('button', { type: 'button' }, 'Update router database');
  dbButton.addEventListener('click', async () => {
    dbNotice.clear();
    dbButton.disabled = true;
    dbNotice.info('Updating the router database…');
    try {
      const a = await updateRouterDb(client);
      dbNotice.success(`The router database was updated; its version is now ${a.router_version}.`);
      await loadList();
    } catch (e) {
      dbNotice.error(e, 'router-list');
    } finally {
      dbButton.disabled = false;
    }
  });

  const el = h(
    'section',
    { class: 'screen', id: 'screen-router', 'aria-labelledby': 'router-title' },
    h('h2', { id: 'router-title' }, 'Router'),
    h(
      'section',
      { class: 'card' },
      h('h3', null, 'Detect the router'),
      h('p', { class: 'hint' }, 'Six checks of the path from this server to the internet and of the router at the default gateway.'),
      h('div', { class: 'actions' }, detectButton),
      detectProgress.el,
      detectNotice.el,
      detectView,
      h('div', { class: 'actions' }, useDetected),
    ),
    h(
      'section',
      { class: 'card' },
      h('h3', null, 'Router configuration'),
      confNotice.el,
      confView,
      form.el,
    ),
    h(
      'section',
      { class: 'card' },
      h('h3', null, 'Known routers'),
      listNotice.el,
      filter,
      listView,
      h('div', { class: 'actions' }, dbButton),
      dbNotice.el,
    ),
  );

  return {
    id: 'router',
    title: 'Router',
    el,
    enter() {
      void loadConf();
      if (!listLoaded) void loadList();
    },
  };
}
