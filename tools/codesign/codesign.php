<?php
// The appliance's code-signing keyring: the GnuPG home against which the
// package tool verifies package signatures. Run by the package center as
//   php codesign.php --import FILE | --listkey | --delete FINGERPRINT
// Exit statuses (docs/feeds.md): 0 done; 1 the file cannot be read, or no
// such key; 2 the file holds no OpenPGP public key; 3 it holds a secret key;
// 4 the keyring cannot be written; 5 wrong usage.
// Every gpg call gets its arguments as a list: no shell ever sees them.

const EXIT_UNREADABLE = 1;
const EXIT_NOT_PUBLIC_KEY = 2;
const EXIT_SECRET_KEY = 3;
const EXIT_KEYRING = 4;
const EXIT_USAGE = 5;

function keyring_home(): string {
    $root = getenv('KIVO_ROOT');
    $root = ($root === false || $root === '') ? '' : rtrim($root, '/');
    return $root . '/usr/kivo/etc/packages/gnupg';
}

// Runs gpg on `home` with `args`; returns [exit status, stdout].
function gpg(string $home, array $args): array {
    $cmd = array_merge(['/usr/bin/gpg', '--homedir', $home, '--batch', '--no-tty',
                        '--no-permission-warning'], $args);
    $spec = [0 => ['file', '/dev/null', 'r'], 1 => ['pipe', 'w'], 2 => ['pipe', 'w']];
    $proc = proc_open($cmd, $spec, $pipes);
    if (!is_resource($proc)) return [-1, ''];
    $out = stream_get_contents($pipes[1]);
    stream_get_contents($pipes[2]);
    fclose($pipes[1]);
    fclose($pipes[2]);
    return [proc_close($proc), $out === false ? '' : $out];
}

function make_home(string $home): bool {
    return is_dir($home) || @mkdir($home, 0700, true);
}

function remove_tree(string $dir): void {
    foreach (scandir($dir) ?: [] as $name) {
        if ($name === '.' || $name === '..') continue;
        $path = $dir . '/' . $name;
        if (is_dir($path) && !is_link($path)) remove_tree($path); else @unlink($path);
    }
    @rmdir($dir);
}

// What the file holds, looked at in a scratch home so that nothing reaches
// the keyring before it has been judged: counts of "pub" and "sec" records.
function inspect_key_file(string $file): array {
    $scratch = sys_get_temp_dir() . '/codesign-' . bin2hex(random_bytes(8));
    if (!@mkdir($scratch, 0700)) return [-1, 0, 0];
    [$status, $out] = gpg($scratch, ['--with-colons', '--show-keys', $file]);
    remove_tree($scratch);
    $pub = 0;
    $sec = 0;
    foreach (explode("\n", $out) as $line) {
        $type = explode(':', $line)[0];
        if ($type === 'pub') $pub++;
        if ($type === 'sec' || $type === 'ssb') $sec++;
    }
    return [$status, $pub, $sec];
}

function import_key(string $file): int {
    if ($file === '' || strpos($file, "\0") !== false || !is_file($file) || !is_readable($file)) {
        return EXIT_UNREADABLE;
    }
    [$status, $pub, $sec] = inspect_key_file($file);
    if ($sec > 0) return EXIT_SECRET_KEY;
    if ($status !== 0 || $pub === 0) return EXIT_NOT_PUBLIC_KEY;
    $home = keyring_home();
    if (!make_home($home)) return EXIT_KEYRING;
    [$status] = gpg($home, ['--import', '--import-options', 'import-clean', $file]);
    return $status === 0 ? 0 : EXIT_KEYRING;
}

function unescape_colons(string $text): string {
    return preg_replace_callback('/\\\\x([0-9a-fA-F]{2})/', fn($m) => chr(hexdec($m[1])), $text);
}

// A key may carry any number of user ids of any length, and the web API reads
// the listing as one line of at most 128 KiB: each key lists at most
// MAX_LISTED_UIDS of them, each cut to MAX_UID_BYTES, and says how many more
// it has, so that one large key cannot make the keyring unlistable.
const MAX_LISTED_UIDS = 8;
const MAX_UID_BYTES = 200;

function shortened_uid(string $uid): string {
    if (strlen($uid) <= MAX_UID_BYTES) return $uid;
    // Cut on a character boundary: drop a trailing partial UTF-8 sequence.
    $cut = preg_replace('/[\xC0-\xFF][\x80-\xBF]*$/', '', substr($uid, 0, MAX_UID_BYTES));
    return $cut . '…';
}

function listed_uids(array $uids): array {
    $listed = array_map('shortened_uid', array_slice($uids, 0, MAX_LISTED_UIDS));
    $more = count($uids) - MAX_LISTED_UIDS;
    if ($more > 0) $listed[] = sprintf('(and %d more user ids)', $more);
    return $listed;
}

// One JSON line: [{"fingerprint", "uids", "created", "expires", "revoked"}].
function list_keys(): int {
    $home = keyring_home();
    $keys = [];
    if (is_dir($home)) {
        [$status, $out] = gpg($home, ['--with-colons', '--fixed-list-mode', '--list-keys']);
        if ($status !== 0 && $status !== 2) return EXIT_KEYRING;
        $key = null;
        foreach (explode("\n", $out) as $line) {
            $f = explode(':', $line);
            if ($f[0] === 'pub') {
                if ($key !== null) $keys[] = $key;
                $key = ['fingerprint' => '', 'uids' => [], 'created' => (int)($f[5] ?? 0),
                        'expires' => ($f[6] ?? '') === '' ? null : (int)$f[6],
                        'revoked' => ($f[1] ?? '') === 'r'];
            } elseif ($key !== null && $f[0] === 'fpr' && $key['fingerprint'] === '') {
                $key['fingerprint'] = $f[9] ?? '';
            } elseif ($key !== null && $f[0] === 'uid') {
                $key['uids'][] = unescape_colons($f[9] ?? '');
            }
        }
        if ($key !== null) $keys[] = $key;
    }
    foreach ($keys as &$listed) $listed['uids'] = listed_uids($listed['uids']);
    unset($listed);
    $flags = JSON_UNESCAPED_SLASHES | JSON_UNESCAPED_UNICODE | JSON_INVALID_UTF8_SUBSTITUTE;
    echo json_encode($keys, $flags), "\n";
    return 0;
}

function delete_key(string $fpr): int {
    if (!preg_match('/^([0-9A-Fa-f]{40}|[0-9A-Fa-f]{64})$/', $fpr)) return EXIT_UNREADABLE;
    $home = keyring_home();
    [$status] = gpg($home, ['--with-colons', '--list-keys', $fpr]);
    if ($status !== 0) return EXIT_UNREADABLE;
    [$status] = gpg($home, ['--yes', '--delete-keys', $fpr]);
    return $status === 0 ? 0 : EXIT_KEYRING;
}

function main(array $argv): int {
    $action = $argv[1] ?? '';
    if ($action === '--import' && count($argv) === 3) return import_key($argv[2]);
    if ($action === '--listkey' && count($argv) === 2) return list_keys();
    if ($action === '--delete' && count($argv) === 3) return delete_key($argv[2]);
    fwrite(STDERR, "usage: codesign.php --import FILE | --listkey | --delete FINGERPRINT\n");
    return EXIT_USAGE;
}

exit(main($argv));
