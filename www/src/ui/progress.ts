// A progress bar with a line of text beside it, for every long operation.

import { h } from '../dom';

export interface Progress {
  el: HTMLElement;
  // percentage 0..100, or null for "under way, amount unknown".
  set(percentage: number | null, text: string): void;
  hide(): void;
}

export function createProgress(label: string): Progress {
  const bar = h('progress', { max: '100', 'aria-label': label });
  const text = h('span', { class: 'progress-text' });
  const el = h('div', { class: 'progress' }, bar, text);
  el.hidden = true;
  return {
    el,
    set(percentage, line) {
      if (percentage === null) {
        bar.removeAttribute('value');
      } else {
        const p = Math.max(0, Math.min(100, Math.round(percentage)));
        bar.value = p;
        line = `${line} (${p}%)`;
      }
      text.textContent = line;
      el.hidden = false;
    },
    hide() {
      el.hidden = true;
    },
  };
}
