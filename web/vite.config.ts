import { defineConfig } from 'vite';
import preact from '@preact/preset-vite';

// The page is served by the appliance's own web server next to the web API,
// whose Content-Security-Policy allows only this page's own files: no inline
// scripts or styles, so assets are always emitted as files.
export default defineConfig({
  plugins: [preact({ devToolsEnabled: false, prefreshEnabled: false })],
  build: {
    outDir: process.env.KIVO_PAGE_OUT ?? 'dist',
    emptyOutDir: true,
    assetsInlineLimit: 0,
    modulePreload: { polyfill: false },
    sourcemap: false,
  },
  server: {
    // `npx vite` next to a running demo: the API calls go to it.
    proxy: { '/webapi': `http://127.0.0.1:${process.env.KIVO_PORT ?? '5000'}` },
  },
});
