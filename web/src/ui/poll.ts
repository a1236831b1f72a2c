// The page's one way of asking the appliance again and again: a package
// list while some package is busy, a task's progress until it ends. The
// state lives on the appliance, so the page asks only while an answer can
// change by itself, and stops with the component.

import { useCallback, useEffect, useRef, useState } from 'preact/hooks';
import { kNoAnswer, type Result } from '../api/client';

export interface PollOptions<T> {
  // How long after an answer the next question goes out.
  everyMs: number;
  // Whether to ask again after `result`; polling stops at the first answer
  // for which it is false (a manual `reload` starts it again).
  again: (result: Result<T>) => boolean;
  // Nothing is asked while false.
  active?: boolean;
  // The first question, too, waits `everyMs`: for a task whose start goes
  // out at the same moment.
  waitFirst?: boolean;
  // Questions in a row that may bring no answer at all (kNoAnswer: a busy
  // appliance, a network blip) and are asked again regardless of `again`
  // before that result counts: while they are, `retrying` is true.
  missesRetried?: number;
}

export interface Polled<T> {
  // The latest answer; null until the first arrives.
  result: Result<T> | null;
  // Asks again now.
  reload: () => Promise<void>;
  // `result` brought no answer and is being asked again (missesRetried).
  retrying: boolean;
}

function isMiss<T>(result: Result<T>): boolean {
  return !result.ok && result.error.code === kNoAnswer;
}

// Asks `load` at once (after `everyMs` with `waitFirst`) and again whenever
// `load` changes (its inputs did), whenever `reload` is called, and
// `everyMs` after each answer that `again` accepts. An answer that comes
// after a newer question went out, or after the component is gone or made
// inactive, is dropped, so `result` is always the answer to the latest
// question.
export function usePoll<T>(
  load: () => Promise<Result<T>>,
  { everyMs, again, active = true, waitFirst = false, missesRetried = 0 }: PollOptions<T>,
): Polled<T> {
  const [result, setResult] = useState<Result<T> | null>(null);
  const latest = useRef(0);
  const misses = useRef(0);  // answers in a row, up to `result`, that did not come
  const reload = useCallback(async () => {
    const mine = ++latest.current;
    const answer = await load();
    if (mine !== latest.current) return;
    misses.current = isMiss(answer) ? misses.current + 1 : 0;
    setResult(answer);
  }, [load]);
  useEffect(() => {
    if (!active) return;
    let first: ReturnType<typeof setTimeout> | undefined;
    if (waitFirst) first = setTimeout(reload, everyMs);
    else void reload();
    return () => {
      clearTimeout(first);
      ++latest.current;
    };
  }, [reload, active]);
  const retrying = result !== null && isMiss(result) && misses.current <= missesRetried;
  const polling = active && result !== null && (retrying || again(result));
  useEffect(() => {
    if (!polling) return;
    const timer = setTimeout(reload, everyMs);
    return () => clearTimeout(timer);
  }, [polling, result, reload, everyMs]);
  return { result, reload, retrying };
}
