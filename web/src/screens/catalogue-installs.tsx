// Installing from the catalogue: a plain download first, the install wizard
// (ui/server-install.tsx) once it is done, then a quick install whose
// progress the card follows. An upgrade runs in its own dialog from the
// download to its end (ui/upgrade-flow.tsx), the same as from the installed
// list. A switch of origin is asked for in words first. Each step records
// the package's phase in the catalogue's state.

import { useEffect, useRef, useState } from 'preact/hooks';
import type { Api } from '../api/client';
import { ToolCode } from '../api/codes';
import { cancelTask, startDownload, startedTaskId, type TaskData } from '../api/installation';
import { messageFor } from '../api/messages';
import type { ServerEntry } from '../api/server';
import { Dialog } from '../ui/dialog';
import { OriginSwitch } from '../ui/origin-switch';
import { ServerInstall, type InstallOutcome } from '../ui/server-install';
import { taskEnd, type TaskEnd } from '../ui/task-progress';
import { UpgradeFlow, type UpgradeResume } from '../ui/upgrade-flow';
import type { EntryActions } from './catalogue-card';
import { phaseTaskId, type CatalogueState, type Phase } from './catalogue-state';

interface Upgrading {
  entry: ServerEntry;
  resume?: UpgradeResume;
}

interface Installs {
  // What the card of `entry` does.
  actionsFor: (entry: ServerEntry) => EntryActions;
  // The install wizard, the upgrade and the origin question, when open.
  dialogs: { wizard: { entry: ServerEntry; taskId: string } | null; upgrade: Upgrading | null; switchAsk: ServerEntry | null };
  switching: (entry: ServerEntry) => boolean;
  // Whether the upgrade dialog follows the package's tasks now: its card
  // then leaves them to the dialog (a finished install's end is read once).
  inDialog: (entry: ServerEntry) => boolean;
  closeWizard: (entry: ServerEntry, outcome: InstallOutcome) => void;
  closeUpgrade: () => void;
  answerSwitch: (entry: ServerEntry, confirmed: boolean) => void;
}

export function useInstalls(api: Api, { load, phases, setPhase, lastLoad }: CatalogueState): Installs {
  const [wizard, setWizard] = useState<{ entry: ServerEntry; taskId: string } | null>(null);
  const [upgrade, setUpgrade] = useState<Upgrading | null>(null);
  // The entry whose source the administrator is asked to switch to.
  const [switchAsk, setSwitchAsk] = useState<ServerEntry | null>(null);
  // Packages being installed with their origin switched to the entry's
  // source, by the administrator's confirmation.
  const switching = useRef(new Set<string>());
  // Packages whose download this page started: their wizard opens by itself
  // when the download is done (another tab only offers to continue).
  const mine = useRef(new Map<string, ServerEntry>());

  // The wizard opens when the page's own download is seen done, whichever
  // way the page learns it: its progress reading the task's end, or a
  // catalogue answer that reports the download done before the progress
  // read it (a refresh as the download ends), which ends the progress.
  // This effect only ever opens: it may run with the phases of a render
  // from before the Install click (Preact runs a render's pending effects
  // before the next one), which know nothing of the download yet. The
  // download is forgotten where the page learns that it ended otherwise.
  useEffect(() => {
    for (const [id, entry] of mine.current) {
      const phase = phases[id];
      if (phase?.kind !== 'downloaded') continue;
      mine.current.delete(id);
      setWizard({ entry, taskId: phase.taskId });
    }
  }, [phases]);

  const install = async (entry: ServerEntry, switchOrigin = false) => {
    setPhase(entry.id, { kind: 'starting' });
    mine.current.set(entry.id, entry);
    if (switchOrigin) switching.current.add(entry.id);
    else switching.current.delete(entry.id);
    // A plain download first: the wizard needs what the package file says.
    const answer = await startDownload(api, entry, switchOrigin);
    if (answer.ok) return setPhase(entry.id, { kind: 'running', taskId: startedTaskId(answer.data, entry.id) });
    mine.current.delete(entry.id);
    setPhase(entry.id, { kind: 'note', text: messageFor(answer.error), failed: true });
  };

  const ended = (entry: ServerEntry, taskId: string, end: TaskEnd) => {
    if (end.kind === 'done' && end.data.status === 'downloaded' && !end.data.blqinst) {
      setPhase(entry.id, { kind: 'downloaded', taskId });
      return;
    }
    mine.current.delete(entry.id);
    setPhase(entry.id, endPhase(entry, end, lastLoad()));
    // What the package is now (installed, running) comes from the appliance.
    if (end.kind !== 'cancelled') void load();
  };

  // A waiting download went on elsewhere: follow the install, or say how
  // it ended when it ended already.
  const waitingChanged = (entry: ServerEntry, taskId: string, data: TaskData) => {
    if (data.finished) ended(entry, taskId, taskEnd(data));
    else setPhase(entry.id, { kind: 'running', taskId });
  };

  const discard = async (entry: ServerEntry, taskId: string) => {
    const answer = await cancelTask(api, taskId);
    if (answer.ok) setPhase(entry.id, { kind: 'note', text: 'The download was discarded.', failed: false });
    else setPhase(entry.id, { kind: 'note', text: messageFor(answer.error), failed: true });
  };

  const actionsFor = (entry: ServerEntry): EntryActions => {
    const phase = phases[entry.id];
    const downloaded = phase?.kind === 'downloaded' ? phase.taskId : null;
    return {
      onInstall: () => void install(entry),
      onUpgrade: () => setUpgrade({ entry }),
      onSwitch: () => setSwitchAsk(entry),
      onEnd: (end) => ended(entry, phaseTaskId(phase, entry), end),
      onWaitingChanged: (data) => waitingChanged(entry, phaseTaskId(phase, entry), data),
      onContinue: () => {
        if (!downloaded) return;
        // An upgrade's download goes on in the upgrade's own dialog.
        if (entry.blupgrade && !switching.current.has(entry.id)) setUpgrade({ entry, resume: { downloaded } });
        else setWizard({ entry, taskId: downloaded });
      },
      onDiscard: () => {
        if (downloaded) void discard(entry, downloaded);
      },
    };
  };

  const closeWizard = (entry: ServerEntry, outcome: InstallOutcome) => {
    setWizard(null);
    if (outcome.kind === 'started') setPhase(entry.id, { kind: 'running', taskId: outcome.taskId });
    else if (outcome.kind === 'discarded') setPhase(entry.id, outcome.reason ? { kind: 'note', text: outcome.reason, failed: true } : null);
  };

  const closeUpgrade = () => {
    if (upgrade) setPhase(upgrade.entry.id, null);
    setUpgrade(null);
    // The card follows whatever goes on from here, as the appliance says.
    void load();
  };

  const answerSwitch = (entry: ServerEntry, confirmed: boolean) => {
    setSwitchAsk(null);
    if (confirmed) void install(entry, true);
  };

  return {
    actionsFor,
    dialogs: { wizard, upgrade, switchAsk },
    switching: (entry) => switching.current.has(entry.id),
    inDialog: (entry) => upgrade?.entry.id === entry.id,
    closeWizard,
    closeUpgrade,
    answerSwitch,
  };
}

// The phase a task's end leaves (a download done waiting for the wizard
// aside): a note on how it ended, or none. `load` is the latest catalogue
// load asked for when it ended.
function endPhase(entry: ServerEntry, end: TaskEnd, load: number): Phase | null {
  const name = entry.dname || entry.id;
  if (end.kind === 'failed') return { kind: 'note', text: end.text, failed: true, originRefused: end.result === ToolCode.OtherOrigin };
  if (end.kind === 'cancelled') return { kind: 'note', text: `The download of ${name} was cancelled.`, failed: false };
  if (end.kind === 'done' && end.data.status === 'installed') {
    const text = entry.blupgrade ? `${name} is upgraded to ${entry.version}.` : `${name} is installed.`;
    return { kind: 'installed', text, since: load };
  }
  return null;
}

// The install wizard, the upgrade and the question whether to switch a
// package's origin, whichever is open. `sourceOf` names where an entry
// comes from.
export function InstallDialogs({ installs, sourceOf }: { installs: Installs; sourceOf: (entry: ServerEntry) => string }) {
  const { wizard, upgrade, switchAsk } = installs.dialogs;
  return (
    <>
      {wizard && (
        <ServerInstall
          entry={wizard.entry}
          taskId={wizard.taskId}
          switchOrigin={installs.switching(wizard.entry)}
          onClose={(outcome) => installs.closeWizard(wizard.entry, outcome)}
        />
      )}
      {upgrade && <UpgradeFlow entry={upgrade.entry} resume={upgrade.resume} onClose={installs.closeUpgrade} />}
      {switchAsk && (
        <Dialog title={`Switch the origin of ${switchAsk.dname || switchAsk.id}`} onClose={() => installs.answerSwitch(switchAsk, false)}>
          <OriginSwitch
            name={switchAsk.dname || switchAsk.id}
            installedFrom={switchAsk.other_origin}
            source={sourceOf(switchAsk)}
            onSwitch={() => installs.answerSwitch(switchAsk, true)}
            onCancel={() => installs.answerSwitch(switchAsk, false)}
          />
        </Dialog>
      )}
    </>
  );
}
