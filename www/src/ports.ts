// Port text syntax of the rules: items separated by ",", each item a single
// port "a", a range "a-b" (a <= b) or an open range "a-" (a up to 65535);
// ports 0..65535. Ports always travel as text.

export const MAX_PORT = 65535;

export interface PortItem {
  from: number;
  to: number | null; // null: open range up to MAX_PORT
  single: boolean;
}

export type PortParse =
  | { ok: true; items: PortItem[]; text: string }
  | { ok: false; error: string };

const ITEM = /^(\d{1,5})(-(\d{1,5})?)?$/;

export function parsePorts(input: string): PortParse {
  const trimmed = input.trim();
  if (trimmed === '') return { ok: false, error: 'Enter a port or a range.' };
  const items: PortItem[] = [];
  for (const raw of trimmed.split(',')) {
    const part = raw.trim();
    if (part === '') return { ok: false, error: 'There is an empty item between two commas.' };
    const m = ITEM.exec(part);
    if (!m) {
      return {
        ok: false,
        error: `“${part}” is not a port or a range; write for example 80, 8000-8010 or 9000-.`,
      };
    }
    const from = Number(m[1]);
    if (from > MAX_PORT) return { ok: false, error: `Port ${from} is above ${MAX_PORT}.` };
    if (m[2] === undefined) {
      items.push({ from, to: from, single: true });
      continue;
    }
    if (m[3] === undefined) {
      items.push({ from, to: null, single: false });
      continue;
    }
    const to = Number(m[3]);
    if (to > MAX_PORT) return { ok: false, error: `Port ${to} is above ${MAX_PORT}.` };
    if (to < from) return { ok: false, error: `The range ${part} ends below its start.` };
    items.push({ from, to, single: false });
  }
  return { ok: true, items, text: formatPorts(items) };
}

export function formatPorts(items: PortItem[]): string {
  return items
    .map((i) => (i.single ? String(i.from) : i.to === null ? `${i.from}-` : `${i.from}-${i.to}`))
    .join(',');
}

// Number of ports that the items cover, counting overlaps more than once.
export function countPorts(items: PortItem[]): number {
  return items.reduce((n, i) => n + (i.to ?? MAX_PORT) - i.from + 1, 0);
}
