// The release notes of the version an upgrade installs, shown before the
// upgrade: from the catalogue entry ("changelog") for an upgrade from a
// package server, from the uploaded file's answer for a manual one
// (docs/package-format.md, "Release notes"). The notes are the author's
// plain text and are shown as text, never as markup: Preact puts them in a
// text node. Without notes, the new version's description is what it says
// about itself.

import './release-notes.css';

export function ReleaseNotes({ version, notes, description }: { version: string; notes?: string; description?: string }) {
  const text = notes?.trim() ?? '';
  if (text === '' && !description) return null;
  return (
    <section class="release-notes" aria-labelledby="release-notes-title">
      <h3 id="release-notes-title">{text !== '' ? `What's new in ${version}` : `About ${version}`}</h3>
      {text !== '' ? (
        <pre class="release-notes-text" tabIndex={0} aria-label={`Release notes of ${version}`}>
          {text}
        </pre>
      ) : (
        <p>{description}</p>
      )}
    </section>
  );
}
