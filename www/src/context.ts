// What every screen gets: the API client, the page's one-job guard and a
// signal that is aborted when the session ends (logout or expiry), which
// stops every poll loop of the session.

import type { ApiClient } from './api/client';
import type { JobGuard } from './jobs';

export interface AppContext {
  client: ApiClient;
  jobs: JobGuard;
  signal: AbortSignal;
}

export interface Screen {
  id: string;
  title: string;
  el: HTMLElement;
  // Called each time the screen is shown.
  enter(): void;
}
