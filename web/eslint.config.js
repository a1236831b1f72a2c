import js from '@eslint/js';
import tseslint from 'typescript-eslint';

// Selectors of strings (plain or in a template) that contain `pattern`.
function spelled(pattern, what) {
  const message = `This spells ${what}.`;
  return [
    { selector: `Literal[value=${pattern}]`, message },
    { selector: `TemplateElement[value.raw=${pattern}]`, message },
  ];
}

const kApiNameSpelled = spelled(/KIVO\./, 'an API name: call the typed function of src/api/ instead');
const kTaskIdSpelled = spelled(/@KIVOPKG_/, 'a task id: use downloadTaskId of src/api/installation.ts');

export default tseslint.config(
  { ignores: ['dist/', 'node_modules/'] },
  js.configs.recommended,
  ...tseslint.configs.recommended,
  {
    rules: {
      '@typescript-eslint/no-unused-vars': ['error', { argsIgnorePattern: '^_' }],
      eqeqeq: 'error',
      'no-console': ['error', { allow: ['warn', 'error'] }],
    },
  },
  // The API's names are spelled once, in the typed calls of src/api/, and the
  // task ids' prefix once, in src/api/installation.ts: screens and shared
  // parts call those instead of writing the names again.
  {
    files: ['src/**/*.{ts,tsx}'],
    ignores: ['src/api/**'],
    rules: { 'no-restricted-syntax': ['error', ...kApiNameSpelled, ...kTaskIdSpelled] },
  },
  {
    files: ['src/api/**/*.ts'],
    ignores: ['src/api/installation.ts'],
    rules: { 'no-restricted-syntax': ['error', ...kTaskIdSpelled] },
  },
  {
    files: ['e2e/**/*.ts'],
    rules: { 'no-console': 'off' },
  },
);
