// Test screen: whether forwarded ports answer from the internet, for the
// saved rules or for chosen services, with each rule's result as it comes.

import {
  checkServices,
  loadRules,
  testRules,
  testServices,
  type Rule,
  type TestStatus,
} from '../api/portforward';
import type { AppContext, Screen } from '../context';
import { h, replaceChildren } from '../dom';
import { runExclusive } from '../jobs';
import { createNotice } from '../ui/notice';
import { createProgress } from '../ui/progress';
import { renderRulesTable } from './rulesTable';

export const TEST_POLL = { intervalMs: 500, maxPolls: 1200 };

export const TEST_STATUS_TEXT: Record<string, string> = {
  wait: 'Preparing the test',
  update: 'Testing',
  success: 'Test finished',
};

// Share of results that came in, and a line of words.
export function testProgress(s: TestStatus): { percentage: number | null; text: string } {
  const results = Object.values(s.rules ?? {});
  const done = results.filter((r) => r !== 'testing').length;
  const base = TEST_STATUS_TEXT[s.status] ?? s.status;
  if (s.status === 'success') return { percentage: 100, text: `${base}: ${done} result${done === 1 ? '' : 's'}` };
  if (results.length === 0) return { percentage: null, text: base };
  return { percentage: (done / results.length) * 100, text: `${base}: ${done} of ${results.length}` };
}

export function resultText(r: string): string {
  return r === 'testing' ? 'Testing…' : r;
}

// Results without a matching rule (service tests name rules "<service>.tcp").
export function renderResultList(results: Record<string, string>): HTMLTableElement {
  const entries = Object.entries(results);
  return h(
    'table',
    { class: 'test-results' },
    h('thead', null, h('tr', null, h('th', { scope: 'col' }, 'Rule'), h('th', { scope: 'col' }, 'Result'))),
    h(
      'tbody',
      null,
      entries.length === 0
        ? h('tr', { class: 'empty' }, h('td', { colspan: '2' }, 'No results yet.'))
        : entries.map(([k, v]) => h('tr', { dataset: { rule: k } }, h('td', null, k), h('td', { class: 'result' }, resultText(v)))),
    ),
  );
}

export function createTestScreen(ctx: AppContext): Screen {
  const { client, jobs } = ctx;
  const notice = createNotice();
  const progress = createProgress('Test progress');
  const resultsBox = h('div', { class: 'results-box' });
  const serviceBox = h('div', { class: 'service-choice' });
  const startButton = h('button', { type: 'button', class: 'primary' }, 'Start test');
  const modeRules = h('input', { type: 'radio', name: 'test-mode', id: 'test-mode-rules', value: 'rules', checked: true });
  const modeServ = h('input', { type: 'radio', name: 'test-mode', id: 'test-mode-services', value: 'services' });

  let services: string[] = [];
  const chosen = new Set<string>();
  let rules: Rule[] | null = null;

  const renderServiceChoice = () => {
    if (!modeServ.checked) {
      serviceBox.hidden = true;
      return;
    }
    serviceBox.hidden = false;
    replaceChildren(
      serviceBox,
      services.length === 0
        ? h('p', { class: 'loading' }, 'Reading the services…')
        : h(
            'ul',
            { class: 'choices' },
            services.map((id) =>
              h(
                'li',
                null,
                h(
                  'label',
                  null,
                  h('input', {
                    type: 'checkbox',
                    value: id,
                    checked: chosen.has(id),
                    onchange: (ev: Event) => {
                      if ((ev.target as HTMLInputElement).checked) chosen.add(id);
                      else chosen.delete(id);
                    },
                  }),
                  ` ${id}`,
                ),
              ),
            ),
          ),
    );
  };

  async function loadServices(): Promise<void> {
    renderServiceChoice();
    try {
      const a = await checkServices(client);
      services = (a?.service_status ?? []).map((s) => s.service_id);
      renderServiceChoice();
      if (services.length === 0) notice.info('The server has no services to test.');
    } catch (e) {
      replaceChildren(serviceBox);
      notice.error(e, 'services');
    }
  }

  const onMode = () => {
    notice.clear();
    renderServiceChoice();
    if (modeServ.checked && services.length === 0) void loadServices();
  };
  modeRules.addEventListener('change', onMode);
  modeServ.addEventListener('change', onMode);

  const showResults = (s: TestStatus) => {
    const p = testProgress(s);
    progress.set(p.percentage, p.text);
    const results = s.rules ?? {};
    if (rules && modeRules.checked) {
      replaceChildren(resultsBox, renderRulesTable(rules, { results: Object.fromEntries(Object.entries(results).map(([k, v]) => [k, resultText(v)])) }));
      const extra = Object.fromEntries(Object.entries(results).filter(([k]) => !rules!.some((r) => r.rule_id === k)));
      if (Object.keys(extra).length > 0) resultsBox.appendChild(renderResultList(extra));
    } else {
      replaceChildren(resultsBox, renderResultList(results));
    }
  };

  startButton.addEventListener('click', async () => {
    notice.clear();
    const byServices = modeServ.checked;
    if (byServices && chosen.size === 0) {
      notice.warn('Choose at least one service to test.');
      return;
    }
    startButton.disabled = true;
    replaceChildren(resultsBox);
    progress.set(null, 'Starting the test');
    try {
      const final = await runExclusive(client, jobs, 'reachability test', async () => {
        if (!byServices) {
          try {
            rules = await loadRules(client);
          } catch {
            // Results are then listed by rule id alone.
            rules = null;
          }
        }
        const opts = { ...TEST_POLL, signal: ctx.signal, onUpdate: showResults };
        return byServices ? testServices(client, [...chosen], opts) : testRules(client, opts);
      });
      showResults(final);
      const n = Object.keys(final.rules ?? {}).length;
      if (n === 0) notice.info('The test finished; there was no rule to test.');
      else notice.success(`The test finished with ${n} result${n === 1 ? '' : 's'}.`);
    } catch (e) {
      progress.hide();
      notice.error(e, 'test');
    } finally {
      startButton.disabled = false;
    }
  });

  const el = h(
    'section',
    { class: 'screen', id: 'screen-test', 'aria-labelledby': 'test-title' },
    h('h2', { id: 'test-title' }, 'Test'),
    h(
      'section',
      { class: 'card' },
      h('p', { class: 'hint' }, 'Checks from the internet whether forwarded ports answer.'),
      h(
        'fieldset',
        null,
        h('legend', null, 'What to test'),
        h('label', { class: 'radio', for: 'test-mode-rules' }, modeRules, ' The saved rules'),
        h('label', { class: 'radio', for: 'test-mode-services' }, modeServ, ' Chosen services'),
      ),
      serviceBox,
      h('div', { class: 'actions' }, startButton),
      progress.el,
      notice.el,
      resultsBox,
    ),
  );
  serviceBox.hidden = true;

  return { id: 'test', title: 'Test', el, enter() {} };
}
