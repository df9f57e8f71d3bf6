import { describe, expect, it } from 'vitest';
import { countPorts, parsePorts } from '../src/ports';

describe('parsePorts', () => {
  it.each([
    ['80', '80'],
    ['0', '0'],
    ['65535', '65535'],
    ['8000-8010', '8000-8010'],
    ['9000-', '9000-'],
    ['80,443,8000-8010,9000-', '80,443,8000-8010,9000-'],
    [' 80 , 443 ', '80,443'],
    ['080', '80'],
    ['80-80', '80-80'],
    ['0-65535', '0-65535'],
  ])('accepts %j as %j', (input, text) => {
    const r = parsePorts(input);
    expect(r).toMatchObject({ ok: true, text });
  });

  it.each([
    ['', /Enter a port/],
    ['   ', /Enter a port/],
    ['65536', /65536 is above 65535/],
    ['80-70000', /70000 is above 65535/],
    ['http', /not a port or a range/],
    ['80-70', /ends below its start/],
    [',80', /empty item/],
    ['80,,81', /empty item/],
    ['80,', /empty item/],
    ['80-90-100', /not a port or a range/],
    ['-80', /not a port or a range/],
    ['1.5', /not a port or a range/],
    ['80 81', /not a port or a range/],
    ['+80', /not a port or a range/],
    ['123456', /not a port or a range/],
  ])('refuses %j', (input, message) => {
    const r = parsePorts(input);
    expect(r.ok).toBe(false);
    if (!r.ok) expect(r.error).toMatch(message);
  });

  it('returns the items it read', () => {
    const r = parsePorts('22,8000-8002,9000-');
    expect(r.ok && r.items).toEqual([
      { from: 22, to: 22, single: true },
      { from: 8000, to: 8002, single: false },
      { from: 9000, to: null, single: false },
    ]);
  });
});

describe('countPorts', () => {
  it('counts single ports, ranges and open ranges', () => {
    const r = parsePorts('22,8000-8002,65530-');
    expect(r.ok && countPorts(r.items)).toBe(1 + 3 + 6);
  });
});
