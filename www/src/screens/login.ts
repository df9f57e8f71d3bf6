// Login screen.

import type { ApiClient } from '../api/client';
import { isApiError } from '../api/client';
import { HostCode } from '../api/codes';
import { errorValue } from '../api/errors';
import { h } from '../dom';
import { createNotice } from '../ui/notice';

export interface LoginScreen {
  el: HTMLElement;
  // A note shown above the form, e.g. why the session ended.
  showReason(err: unknown): void;
  focus(): void;
}

export function createLoginScreen(client: ApiClient, onLoggedIn: () => void): LoginScreen {
  const notice = createNotice();
  const account = h('input', { id: 'login-account', name: 'account', autocomplete: 'username', required: true });
  const passwd = h('input', { id: 'login-passwd', name: 'passwd', type: 'password', autocomplete: 'current-password' });
  const submit = h('button', { type: 'submit', class: 'primary' }, 'Log in');
  let retryTimer: ReturnType<typeof setInterval> | null = null;

  // After a slowed-down login, keep the button off and count down.
  const holdOff = (seconds: number) => {
    let left = Math.ceil(seconds);
    submit.disabled = true;
    submit.textContent = `Log in (wait ${left} s)`;
    if (retryTimer) clearInterval(retryTimer);
    retryTimer = setInterval(() => {
      left--;
      if (left <= 0) {
        if (retryTimer) clearInterval(retryTimer);
        retryTimer = null;
        submit.disabled = false;
        submit.textContent = 'Log in';
      } else {
        submit.textContent = `Log in (wait ${left} s)`;
      }
    }, 1000);
  };

  const form = h(
    'form',
    { class: 'login-form card', novalidate: true },
    h('h2', null, 'Log in'),
    h('p', { class: 'hint' }, 'Port forwarding administration. Use an administrator account of this server.'),
    notice.el,
    h('div', { class: 'field' }, h('label', { for: 'login-account' }, 'Account'), account),
    h('div', { class: 'field' }, h('label', { for: 'login-passwd' }, 'Password'), passwd),
    h('div', { class: 'actions' }, submit),
  );

  form.addEventListener('submit', async (ev) => {
    ev.preventDefault();
    notice.clear();
    if (account.value.trim() === '') {
      notice.warn('Enter the account name.');
      account.focus();
      return;
    }
    submit.disabled = true;
    try {
      await client.login(account.value.trim(), passwd.value);
      passwd.value = '';
      submit.disabled = false;
      onLoggedIn();
    } catch (e) {
      submit.disabled = false;
      notice.error(e, 'login');
      const retry = isApiError(e) && e.code === HostCode.NotAllowed ? errorValue(e.errors, 'retry_after') : undefined;
      if (typeof retry === 'number' && retry > 0) holdOff(retry);
    }
  });

  const el = h('section', { class: 'screen', id: 'screen-login' }, form);
  return {
    el,
    showReason(err) {
      notice.error(err);
    },
    focus() {
      account.focus();
    },
  };
}
