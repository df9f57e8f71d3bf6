import { defineConfig } from 'vitest/config';

// The web API host serves the built files at "/" and the API under /webapi/.
// During `npm run dev`, ZARK_HOST_URL (for example http://127.0.0.1:8080)
// names a running host to which /webapi requests are passed on.
const hostUrl = process.env.ZARK_HOST_URL;

export default defineConfig({
  base: '/',
  build: {
    outDir: 'dist',
    emptyOutDir: true,
    sourcemap: true,
    target: 'es2022',
  },
  server: hostUrl ? { proxy: { '/webapi': { target: hostUrl, changeOrigin: false } } } : {},
  test: {
    environment: 'happy-dom',
    include: ['tests/**/*.test.ts'],
    restoreMocks: true,
    reporters: ['default', './tests/countReporter.ts'],
  },
});
