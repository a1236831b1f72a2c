import type { ApiFailure } from '../api/client';
import { messageFor } from '../api/messages';

// An API failure in words, announced to screen readers as it appears.
export function ErrorText({ error }: { error: ApiFailure | null | undefined }) {
  if (!error) return null;
  return (
    <p class="error" role="alert" data-code={error.code}>
      {messageFor(error)}
    </p>
  );
}
