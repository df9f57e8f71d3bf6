// The page shell: login or the screens with their navigation, and the
// session's life (logout, expiry).

import type { ApiClient, ApiError } from './api/client';
import type { AppContext, Screen } from './context';
import { h, replaceChildren } from './dom';
import { JobGuard } from './jobs';
import { createCompatScreen } from './screens/compat';
import { createLoginScreen } from './screens/login';
import { createRouterScreen } from './screens/router';
import { createRulesScreen } from './screens/rules';
import { createServicesScreen } from './screens/services';
import { createTestScreen } from './screens/test';

export const SCREEN_IDS = ['router', 'rules', 'services', 'test', 'compat'] as const;

export function screenFromHash(hash: string): string {
  const id = hash.replace(/^#\/?/, '');
  return (SCREEN_IDS as readonly string[]).includes(id) ? id : 'router';
}

export function startApp(root: HTMLElement, client: ApiClient): void {
  let session: AbortController | null = null;
  let onHash: (() => void) | null = null;

  const endSession = () => {
    session?.abort();
    session = null;
    if (onHash) window.removeEventListener('hashchange', onHash);
    onHash = null;
  };

  const showLogin = (reason?: unknown) => {
    endSession();
    const login = createLoginScreen(client, showApp);
    replaceChildren(
      root,
      h('header', { class: 'top' }, h('h1', null, 'Port forwarding')),
      h('main', null, login.el),
    );
    if (reason !== undefined) login.showReason(reason);
    login.focus();
  };

  client.onSessionLost = (err: ApiError) => showLogin(err);

  function showApp(): void {
    endSession();
    session = new AbortController();
    const ctx: AppContext = { client, jobs: new JobGuard(), signal: session.signal };
    const screens: Screen[] = [
      createRouterScreen(ctx),
      createRulesScreen(ctx),
      createServicesScreen(ctx),
      createTestScreen(ctx),
      createCompatScreen(ctx),
    ];
    const links = screens.map((s) => h('a', { href: `#/${s.id}`, dataset: { screen: s.id } }, s.title));
    const jobLine = h('span', { class: 'job-line', role: 'status' });
    ctx.jobs.subscribe((running) => {
      jobLine.textContent = running ? `Running: ${running}` : '';
    });
    const logout = h('button', { type: 'button', class: 'link' }, 'Log out');
    logout.addEventListener('click', async () => {
      if (ctx.jobs.running && !window.confirm(`${ctx.jobs.running} is still running. It goes on on the server, but this page stops following it. Log out?`)) return;
      endSession();
      try {
        await client.logout();
        showLogin();
      } catch (e) {
        // Forgotten here in any case; say that the server was not told.
        showLogin(e);
      }
    });

    const main = h('main', null, screens.map((s) => s.el));
    replaceChildren(
      root,
      h(
        'header',
        { class: 'top' },
        h('h1', null, 'Port forwarding'),
        h('nav', { 'aria-label': 'Screens' }, links),
        jobLine,
        h('span', { class: 'account' }, client.account ?? ''),
        logout,
      ),
      main,
    );

    const show = () => {
      const id = screenFromHash(window.location.hash);
      for (const s of screens) s.el.hidden = s.id !== id;
      for (const a of links) {
        if (a.dataset.screen === id) a.setAttribute('aria-current', 'page');
        else a.removeAttribute('aria-current');
      }
      screens.find((s) => s.id === id)?.enter();
    };
    onHash = show;
    window.addEventListener('hashchange', show);
    show();
  }

  if (client.loggedIn) showApp();
  else showLogin();
}
