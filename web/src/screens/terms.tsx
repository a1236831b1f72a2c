import type { ComponentChildren } from 'preact';
import { useEffect, useState } from 'preact/hooks';
import type { ApiFailure } from '../api/client';
import { agreeToTerms, readPackageCenterInfo } from '../api/terms';
import { useSession } from '../session';
import { ErrorText } from '../ui/error-text';
import './terms.css';

// The vendor publishes the text beside its catalogue, which this appliance's
// web server serves under /feed/.
const kTermsAddress = '/feed/terms-of-service.txt';

type Gate =
  | { kind: 'checking' }
  | { kind: 'failed'; error: ApiFailure }
  | { kind: 'open' }
  | { kind: 'ask'; changed: boolean; hash: string };

// Keeps the package center closed until the signed-in user agreed to the
// current terms of service.
export function TermsGate({ children }: { children: ComponentChildren }) {
  const { api } = useSession();
  const [gate, setGate] = useState<Gate>({ kind: 'checking' });
  const check = async () => {
    setGate({ kind: 'checking' });
    const info = await readPackageCenterInfo(api);
    if (!info.ok) return setGate({ kind: 'failed', error: info.error });
    if (info.data.show_tos === 'no') return setGate({ kind: 'open' });
    setGate({ kind: 'ask', changed: info.data.show_tos === 'change', hash: info.data.tos_hash });
  };
  useEffect(() => {
    void check();
  }, [api]);

  if (gate.kind === 'open') return <>{children}</>;
  return (
    <main class="content">
      {gate.kind === 'checking' && <p class="loading">Loading…</p>}
      {gate.kind === 'failed' && (
        <section class="card terms" aria-labelledby="terms-title">
          <h1 id="terms-title">Package Center</h1>
          <p>The package center's start-up information could not be read.</p>
          <ErrorText error={gate.error} />
          <button type="button" onClick={() => void check()}>
            Try again
          </button>
        </section>
      )}
      {gate.kind === 'ask' && (
        <TermsScreen
          changed={gate.changed}
          hash={gate.hash}
          onAgreed={check}
          onRetry={check}
          onContinue={() => setGate({ kind: 'open' })}
        />
      )}
    </main>
  );
}

function TermsScreen({
  changed,
  hash,
  onAgreed,
  onRetry,
  onContinue,
}: {
  changed: boolean;
  hash: string;
  onAgreed: () => Promise<void>;
  onRetry: () => Promise<void>;
  onContinue: () => void;
}) {
  const { api } = useSession();
  const [text, setText] = useState<string | null>(null);
  const [textFailed, setTextFailed] = useState(false);
  const [error, setError] = useState<ApiFailure | null>(null);
  const [busy, setBusy] = useState(false);
  useEffect(() => {
    fetch(kTermsAddress, { cache: 'no-cache' })
      .then((r) => (r.ok ? r.text() : Promise.reject(new Error(String(r.status)))))
      .then(setText, () => setTextFailed(true));
  }, []);

  const agree = async () => {
    setBusy(true);
    const result = await agreeToTerms(api, hash);
    setBusy(false);
    if (!result.ok) return setError(result.error);
    await onAgreed();
  };

  // Without the current hash the agreement could not name what was agreed
  // to, and the text shown might not be the current one.
  const confirmed = hash !== '';
  // Unconfirmed terms read as changed to the appliance (the agreement names
  // another hash), but the user is told what is known: nothing yet.
  const title = !confirmed ? 'The terms of service could not be confirmed' : changed ? 'The terms of service have changed' : 'Terms of service';
  return (
    <section class="card terms" aria-labelledby="terms-title">
      <h1 id="terms-title">{title}</h1>
      <p>
        {changed && confirmed
          ? 'Please read the new terms of service of the package servers. You can use the package center again once you agree to them.'
          : 'Before you use the package center, please read the terms of service of the package servers and agree to them.'}
      </p>
      {text === null && !textFailed && <p class="hint">Loading the terms…</p>}
      {textFailed && (
        <p class="error" role="alert">
          The text of the terms of service could not be loaded. Check the appliance's connection and try again.
        </p>
      )}
      {text !== null && (
        <div class="terms-text" tabIndex={0} role="region" aria-label="Text of the terms of service">
          {text}
        </div>
      )}
      {!confirmed && (
        <p class="error" role="alert">
          The current terms could not be confirmed with the vendor's server, so they cannot be agreed to now. Try again later,
          or continue for now: the installed packages can be managed without the vendor's server.
        </p>
      )}
      <ErrorText error={error} />
      <div class="buttons">
        {!confirmed && (
          <>
            <button type="button" onClick={onContinue}>
              Continue for now
            </button>
            <button type="button" onClick={() => void onRetry()}>
              Try again
            </button>
          </>
        )}
        <button type="button" class="primary" disabled={busy || text === null || !confirmed} onClick={() => void agree()}>
          I agree
        </button>
      </div>
    </section>
  );
}
