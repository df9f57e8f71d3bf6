// A message area of a screen: errors with what the user can do, and notes.

import { describeError, type ErrorContext } from '../api/errors';
import { h, replaceChildren, type Child } from '../dom';

export interface Notice {
  el: HTMLElement;
  error(err: unknown, ctx?: ErrorContext): void;
  info(text: string): void;
  success(text: string): void;
  warn(text: string): void;
  clear(): void;
}

export function createNotice(): Notice {
  const el = h('div', { class: 'notice', 'aria-live': 'polite' });
  el.hidden = true;
  const show = (kind: string, ...content: Child[]) => {
    el.className = `notice notice-${kind}`;
    el.setAttribute('role', kind === 'error' ? 'alert' : 'status');
    replaceChildren(el, ...content);
    el.hidden = false;
  };
  return {
    el,
    error(err, ctx) {
      const d = describeError(err, ctx);
      show(
        'error',
        h('strong', null, d.title),
        ' ',
        h('span', { class: 'advice' }, d.advice),
        d.code !== null ? h('span', { class: 'code' }, ` (code ${d.code})`) : null,
      );
    },
    info: (text) => show('info', text),
    success: (text) => show('success', text),
    warn: (text) => show('warning', text),
    clear() {
      el.hidden = true;
      replaceChildren(el);
    },
  };
}
