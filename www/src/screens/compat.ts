// Compatibility screen: the router's UPnP compatibility test in five items,
// with stop, and upload of a failed result.

import { isApiError } from '../api/client';
import { ModuleCode } from '../api/codes';
import {
  compatStatus,
  isCompatFinished,
  startCompatTest,
  stopCompatTest,
  uploadCompatResult,
  type CompatStatus,
} from '../api/portforward';
import type { AppContext, Screen } from '../context';
import { h, replaceChildren } from '../dom';
import { runExclusive } from '../jobs';
import { poll } from '../poll';
import { createNotice } from '../ui/notice';
import { createProgress } from '../ui/progress';

export const COMPAT_POLL = { intervalMs: 1000, maxPolls: 900 };

export const COMPAT_ITEMS = ['add', 'max', 'del', 'readd', 'con_s'] as const;

export const COMPAT_LABEL: Record<string, string> = {
  add: 'Add a port mapping',
  max: 'Add mappings up to the router’s maximum',
  del: 'Delete the mappings',
  readd: 'Add a mapping again',
  con_s: 'Reach a mapped port from outside',
};

const STATE_TEXT: Record<string, string> = {
  not_test: 'Not tested',
  processing: 'Testing…',
  success: 'Passed',
  failed: 'Failed',
  unknown: 'Waiting',
};

export function compatStateText(item: string, state: string | undefined): { cls: string; text: string } {
  if (state === undefined) return { cls: 'stop', text: 'Not reached' };
  const known = STATE_TEXT[state.toLowerCase()];
  if (known) return { cls: state.toLowerCase(), text: known };
  // "max" passes with the number of mappings the router took.
  if (item === 'max' && /^\d+$/.test(state)) return { cls: 'success', text: `Passed: the router took ${state} mappings` };
  return { cls: 'other', text: state };
}

export function renderCompatItems(s: CompatStatus | null): HTMLOListElement {
  const byName = new Map((s?.test ?? []).map((t) => [t.test_item, t.status]));
  return h(
    'ol',
    { class: 'checklist compat', 'aria-label': 'Compatibility test items' },
    COMPAT_ITEMS.map((name) => {
      const st = s === null ? { cls: 'initial', text: 'Not started' } : compatStateText(name, byName.get(name));
      return h(
        'li',
        { class: `step step-${st.cls}`, dataset: { item: name } },
        h('span', { class: 'label' }, COMPAT_LABEL[name]),
        h('span', { class: 'state' }, st.text),
      );
    }),
  );
}

export function createCompatScreen(ctx: AppContext): Screen {
  const { client, jobs } = ctx;
  const notice = createNotice();
  const progress = createProgress('Compatibility test progress');
  const itemsBox = h('div', { class: 'compat-box' }, renderCompatItems(null));
  const startButton = h('button', { type: 'button', class: 'primary' }, 'Start test');
  const stopButton = h('button', { type: 'button', class: 'danger' }, 'Stop test');
  const uploadButton = h('button', { type: 'button' }, 'Upload the failed result');
  stopButton.disabled = true;
  uploadButton.disabled = true;

  let stopper: AbortController | null = null;
  // What the current run has read so far (written from poll callbacks).
  const run: { last: CompatStatus | null; polled: boolean } = { last: null, polled: false };
  const lastRead = (): CompatStatus | null => run.last;

  const show = (s: CompatStatus) => {
    run.last = s;
    replaceChildren(itemsBox, renderCompatItems(s));
    const pct = typeof s.percentage === 'number' && s.percentage >= 0 ? s.percentage : null;
    const text = s.status === 'success' ? 'Test passed' : s.status === 'failed' ? 'Test failed' : 'Testing';
    progress.set(s.status === 'failed' ? null : pct, text);
  };

  startButton.addEventListener('click', async () => {
    notice.clear();
    run.last = null;
    run.polled = false;
    replaceChildren(itemsBox, renderCompatItems(null));
    startButton.disabled = true;
    uploadButton.disabled = true;
    const local = new AbortController();
    const onSessionEnd = () => local.abort();
    ctx.signal.addEventListener('abort', onSessionEnd, { once: true });
    stopper = local;
    progress.set(0, 'Starting the test');
    try {
      const final = await runExclusive(client, jobs, 'compatibility test', async () => {
        const taskId = await startCompatTest(client);
        stopButton.disabled = false;
        return poll(() => compatStatus(client, taskId), {
          ...COMPAT_POLL,
          signal: local.signal,
          isDone: isCompatFinished,
          onUpdate: (s) => {
            run.polled = true;
            show(s);
          },
        });
      });
      show(final);
      if (final.status === 'success') {
        notice.success('The router passed the UPnP compatibility test.');
      } else {
        notice.warn('The router failed the UPnP compatibility test. You can upload the failed result so that support for this router can be improved.');
        uploadButton.disabled = false;
      }
    } catch (e) {
      if (local.signal.aborted && !ctx.signal.aborted) {
        notice.info('The test was stopped.');
      } else if (run.polled && isApiError(e) && e.code === ModuleCode.Failed) {
        // The task is removed on the first poll that sees it finished; the
        // final state is then the last one read.
        notice.warn('The test task ended before a final result was read; the last state read is shown.');
        if (lastRead()?.status === 'failed') uploadButton.disabled = false;
      } else {
        progress.hide();
        notice.error(e, 'compat');
      }
    } finally {
      ctx.signal.removeEventListener('abort', onSessionEnd);
      stopper = null;
      stopButton.disabled = true;
      startButton.disabled = false;
    }
  });

  stopButton.addEventListener('click', async () => {
    stopButton.disabled = true;
    try {
      await stopCompatTest(client);
      stopper?.abort();
    } catch (e) {
      stopButton.disabled = stopper === null;
      notice.error(e, 'compat');
    }
  });

  uploadButton.addEventListener('click', async () => {
    uploadButton.disabled = true;
    try {
      await uploadCompatResult(client);
      notice.success('The failed result was uploaded.');
    } catch (e) {
      uploadButton.disabled = false;
      notice.error(e, 'compat');
    }
  });

  const el = h(
    'section',
    { class: 'screen', id: 'screen-compat', 'aria-labelledby': 'compat-title' },
    h('h2', { id: 'compat-title' }, 'Compatibility'),
    h(
      'section',
      { class: 'card' },
      h('p', { class: 'hint' }, 'Tests whether the router’s UPnP service can add, fill up, delete and re-add port mappings, and whether a mapped port answers from outside. It takes a few minutes.'),
      h('div', { class: 'actions' }, startButton, stopButton, uploadButton),
      progress.el,
      notice.el,
      itemsBox,
    ),
  );

  return { id: 'compat', title: 'Compatibility', el, enter() {} };
}
