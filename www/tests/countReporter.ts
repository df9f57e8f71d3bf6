// Prints one closing line "N passed, N failed[, N skipped]" after a run, so
// that a CI log reader counts the tests whatever the default reporter prints.

import type { Reporter, TestModule } from 'vitest/node';

export default class CountReporter implements Reporter {
  onTestRunEnd(modules: ReadonlyArray<TestModule>): void {
    let passed = 0;
    let failed = 0;
    let skipped = 0;
    for (const m of modules) {
      for (const t of m.children.allTests()) {
        const state = t.result().state;
        if (state === 'passed') passed++;
        else if (state === 'failed') failed++;
        else skipped++;
      }
      // A file that failed to load has no tests but must still count.
      if (m.state() === 'failed' && [...m.children.allTests()].length === 0) failed++;
    }
    process.stdout.write(`\nwww: ${passed} passed, ${failed} failed${skipped ? `, ${skipped} skipped` : ''}\n`);
  }
}
