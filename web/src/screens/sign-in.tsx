import { useState } from 'preact/hooks';
import type { ApiFailure, Api, SessionInfo } from '../api/client';
import { ErrorText } from '../ui/error-text';
import { TextField } from '../ui/form';

export function SignInScreen({ api, onSignedIn, notice }: { api: Api; onSignedIn: (s: SessionInfo) => void; notice?: string }) {
  const [account, setAccount] = useState('');
  const [password, setPassword] = useState('');
  const [error, setError] = useState<ApiFailure | null>(null);
  const [busy, setBusy] = useState(false);
  const submit = async (e: Event) => {
    e.preventDefault();
    setBusy(true);
    const result = await api.signIn(account, password);
    setBusy(false);
    setPassword('');
    if (result.ok) onSignedIn(result.data);
    else setError(result.error);
  };
  return (
    <main class="sign-in">
      <form class="card" onSubmit={submit} aria-labelledby="sign-in-title">
        <h1 id="sign-in-title">Package Center</h1>
        <p>Sign in with an administrator account of this appliance.</p>
        {notice && <p class="hint">{notice}</p>}
        <TextField id="account" label="Account" autocomplete="username" required value={account} onValue={setAccount} />
        <TextField id="password" label="Password" type="password" autocomplete="current-password" required value={password} onValue={setPassword} />
        <ErrorText error={error} />
        <button type="submit" class="primary" disabled={busy}>
          Sign in
        </button>
      </form>
    </main>
  );
}

// A signed-in user who may not manage packages.
export function NotAdministratorScreen({ account, onSignOut }: { account: string; onSignOut: () => void }) {
  return (
    <main class="sign-in">
      <section class="card" aria-labelledby="refused-title">
        <h1 id="refused-title">Administrators only</h1>
        <p>
          You are signed in as <strong>{account}</strong>, who is not a member of the administrators group. Only
          administrators can install, run and remove packages. Sign in with an administrator account, or ask one to add you
          to the group.
        </p>
        <button type="button" class="primary" onClick={onSignOut}>
          Sign out
        </button>
      </section>
    </main>
  );
}
