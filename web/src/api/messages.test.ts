// Every code the API documents has words in the page, and the details an
// answer carries reach those words. The code lists come from the docs'
// tables and the module's own code list, so a code added to the API without
// a name, a row in the docs or a message fails here.

import assert from 'node:assert/strict';
import { readFileSync } from 'node:fs';
import { test } from 'node:test';
import { kNoAnswer } from './client';
import { HostCode, PackageCode } from './codes';
import { explain, messageFor } from './messages';

const repo = new URL('../../../', import.meta.url);

// The rows of the first table after `heading` (or in the whole file) whose
// first cell is a number: [code, second cell].
function codeRows(file: string, heading?: string): [number, string][] {
  let text = readFileSync(new URL(`docs/${file}`, repo), 'utf8');
  if (heading !== undefined) {
    const at = text.indexOf(`\n${heading}\n`);
    assert.ok(at >= 0, `${file} has no section "${heading}"`);
    text = text.slice(at + heading.length + 2);
    const next = text.search(/\n#+ /);
    if (next >= 0) text = text.slice(0, next);
  }
  const rows: [number, string][] = [];
  for (const line of text.split('\n')) {
    const cells = line.split('|').map((c) => c.trim());
    if (cells.length > 3 && /^\d+$/.test(cells[1])) rows.push([Number(cells[1]), cells[2]]);
  }
  return rows;
}

// What messageFor says of a code it has no words for.
function fallback(code: number): string {
  const unknown = 987654;
  return messageFor({ code: unknown }).replace(String(unknown), String(code));
}

test('every documented code has its own message', () => {
  const host = codeRows('http-api.md', '## Host error codes');
  const module = codeRows('error-codes.md');
  assert.ok(host.length >= 11, `found only ${host.length} host codes in docs/http-api.md`);
  assert.ok(module.length >= 50, `found only ${module.length} module codes in docs/error-codes.md`);
  const missing = [...host, ...module, [kNoAnswer, 'no answer'] as [number, string]]
    .filter(([code]) => messageFor({ code }) === fallback(code))
    .map(([code]) => code);
  assert.deepEqual(missing, [], 'codes without a message');
});

test('codes.ts names each module code as docs/error-codes.md does', () => {
  const byName = new Map<string, number>(Object.entries(PackageCode));
  for (const [code, name] of codeRows('error-codes.md')) {
    const short = name.replace(/^`kErr/, '').replace(/`$/, '');
    assert.equal(byName.get(short), code, `PackageCode.${short}`);
  }
  for (const [code] of codeRows('http-api.md', '## Host error codes')) {
    assert.ok(Object.values(HostCode).includes(code as never), `HostCode has no name for ${code}`);
  }
});

test('codes.ts has every code the package module defines, by its name', () => {
  const header = readFileSync(new URL('package/error_codes.h', repo), 'utf8');
  const defined = [...header.matchAll(/\bkErr(\w+) = (\d+)/g)].map(([, name, code]) => [name, Number(code)]);
  assert.ok(defined.length >= 50, `found only ${defined.length} codes in package/error_codes.h`);
  assert.deepEqual(defined.filter(([name, code]) => (PackageCode as Record<string, number>)[name] !== code), []);
});

test('an unknown code still shows its number, with the package tool words it carries', () => {
  assert.match(messageFor({ code: 4999 }), /\b4999\b/);
  assert.match(messageFor({ code: 4999, errors: { message: 'disk on fire' } }), /4999.*disk on fire/);
});

test('details that say what stands in the way are told', () => {
  const said = (code: number, errors: Record<string, unknown>) => messageFor({ code, errors });
  assert.match(said(HostCode.SignInThrottled, { reason: 'x', retry_after: 30 }), /Try again in 30 seconds\./);
  assert.match(said(HostCode.SignInThrottled, { retry_after: 600 }), /Try again in 10 minutes\./);
  assert.match(said(HostCode.Parameter, { name: 'volume_path', reason: 'required' }), /"volume_path" is missing\./);
  assert.match(said(HostCode.Parameter, { name: 'id', reason: 'condition' }), /"id" is not valid\./);
  assert.match(said(HostCode.NotPermitted, { reason: 'missing or wrong X-KIVO-Token' }), /\(missing or wrong X-KIVO-Token\)/);
  // Lists arrive as arrays, as plain "a, b" text, or as JSON text.
  assert.match(said(PackageCode.StopDependents, { packages: 'demo-web, demo-notes' }), /Running dependents: demo-web, demo-notes\./);
  // A requirement in its text form is told in words.
  assert.match(said(PackageCode.InstallDependency, { packages: '["demo-base>=2"]', message: '' }), /Needed packages: demo-base 2 or later\./);
  assert.match(
    said(PackageCode.DependencyMissing, { uninstall_packages: ['demo-base'], unstart_packages: 'demo-db' }),
    /Not installed: demo-base\. Not running: demo-db\./,
  );
  assert.doesNotMatch(said(PackageCode.StartDependency, { uninstall_packages: [], unstart_packages: 'demo-db' }), /Not installed/);
  assert.match(said(PackageCode.Conflict, { packages: 'demo-old', message: '' }), /Conflicting packages: demo-old\./);
  assert.match(said(PackageCode.ServiceNotRunning, { services: ['pgsql'] }), /Services not running: pgsql\./);
  assert.match(said(PackageCode.PortInUse, { port: 8095 }), /Port 8095 is in use/);
  assert.match(said(PackageCode.OsTooOld, { firmware: '7.2-64570' }), /System version it needs: 7\.2-64570\./);
  assert.match(
    said(PackageCode.StartVersionLimit, { code: 4583, current_version: '1.0', require_version: 'demo-base>=2.0' }),
    /needed: demo-base>=2\.0; installed: 1\.0/,
  );
  assert.match(said(PackageCode.Failed, { failed: 'update_channel' }), /Could not store the update channel; the settings before it/);
  assert.match(said(PackageCode.Failed, { volume_status: 'crashed' }), /The default volume is damaged/);
  assert.match(said(PackageCode.BadParameter, { name: 'index', reason: 'condition' }), /"index" is not valid\./);
  assert.match(said(PackageCode.NotNewer, { current_version: '2.0', install_version: '1.5' }), /in this file: 1\.5; installed: 2\.0/);
});

test('the feasibility check tells its reasons and whether they only ask for a confirmation', () => {
  const hard = explain({ code: PackageCode.NotFeasible, errors: { check_type: 'hard', reasons: ['A backup is running'] } });
  assert.deepEqual(hard.details, ['Reason: A backup is running.']);
  const soft = messageFor({ code: PackageCode.NotFeasible, errors: { check_type: 'soft', reasons: ['Users are connected'] } });
  assert.match(soft, /advises against it: Users are connected\. Confirm to go ahead anyway\./);
  const broken = messageFor({ code: PackageCode.NotFeasible, errors: { check_type: 'hard', reasons: [] } });
  assert.match(broken, /could not be made/);
});

test("the package tool's words and the scripts' messages are told once, the log by its last lines", () => {
  const log = 'step 1\nstep 2\n\nstep 3\npostinst: exit 3\n';
  const text = messageFor({ code: PackageCode.ScriptFailed, errors: { message: log, worker_message: ['Database user is missing'] } });
  assert.match(text, /A script of the package failed\. The package tool said: step 2 step 3 postinst: exit 3 Database user is missing$/);
  assert.doesNotMatch(text, /step 1/);
  const repeated = explain({ code: PackageCode.Failed, errors: { message: 'no volume', worker_message: ['no volume'] } });
  assert.equal(repeated.details.length, 1);
});

test("a batch start or stop tells each failed package's reason under its id", () => {
  const text = messageFor({
    code: PackageCode.StopFailed,
    errors: {
      'demo-web': { data: { message: '' } },
      'demo-base': { code: PackageCode.StopDependents, errors: { packages: 'demo-notes' } },
      'demo-db': { code: PackageCode.Busy },
    },
  });
  assert.match(text, /demo-base: Running packages need this one\. Stop them first\. Running dependents: demo-notes\./);
  assert.match(text, /demo-db: Another package operation is under way/);
  assert.doesNotMatch(text, /demo-web/);
});

test('packages an answer names by id are told by their display names, requirements in words', () => {
  const names: Record<string, string> = { 'demo-web': 'Demo Web', 'demo-notes': 'Demo Notes' };
  const nameOf = (id: string) => names[id] ?? id;
  assert.equal(
    messageFor({ code: PackageCode.StartDependency, errors: { unstart_packages: 'demo-web', uninstall_packages: 'demo-web<2,other' } }, nameOf),
    `${messageFor({ code: PackageCode.StartDependency })} Not installed: Demo Web older than 2, other. Not running: Demo Web.`,
  );
  assert.equal(explain({ code: PackageCode.StopDependents, errors: { packages: ['demo-notes'] } }, nameOf).details[0], 'Running dependents: Demo Notes.');
  assert.equal(explain({ code: PackageCode.StartFailed, errors: { 'demo-web': { code: PackageCode.StartFailed } } }, nameOf).details[0], `Demo Web: ${messageFor({ code: PackageCode.StartFailed })}`);
});
