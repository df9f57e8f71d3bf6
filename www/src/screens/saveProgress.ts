// Words and a percentage for a save_status answer. The apply runs in two
// halves on the router: "del" removes the old mappings, "add" adds the new.

import type { SaveStatus } from '../api/portforward';

export const SAVE_POLL = { intervalMs: 500, maxPolls: 1200 };

export function saveProgressText(s: SaveStatus): { percentage: number; text: string } {
  const pct = typeof s.percentage === 'number' && s.percentage >= 0 ? s.percentage : 0;
  if (s.status === 'success' && pct === 100) return { percentage: 100, text: 'Saved and applied on the router' };
  if (s.stage === 'del') return { percentage: pct, text: 'Removing the old mappings from the router' };
  if (s.stage === 'add') return { percentage: pct, text: 'Adding the new mappings to the router' };
  if (pct <= 1) return { percentage: pct, text: 'Preparing the rules' };
  return { percentage: pct, text: 'Sending the rules to the router' };
}
