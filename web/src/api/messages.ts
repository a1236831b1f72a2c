// Words for every result code the web API can answer. An unknown code still
// shows its number, so a user can report it.

import { kNoAnswer, type ApiFailure } from './client';

const messages: Record<number, string> = {
  [kNoAnswer]: 'The appliance did not answer. Check the connection and try again.',
  100: 'The appliance could not complete the request.',
  101: 'The request was not understood.',
  102: 'The appliance does not offer this function.',
  103: 'The appliance does not offer this function.',
  104: 'The appliance does not offer this version of the function.',
  105: 'You are not allowed to do this: only administrators manage packages.',
  106: 'Your session has expired. Please sign in again.',
  119: 'You are not signed in.',
  120: 'A value sent to the appliance was missing or not valid.',
  400: 'Wrong account or password.',
  407: 'Too many failed sign-ins.',
};

// The sentence for `failure`, with the details the answer carries that a
// user can act on.
export function messageFor(failure: ApiFailure): string {
  const text = messages[failure.code];
  if (text === undefined) return `The appliance answered with error ${failure.code}.`;
  const retry = failure.errors?.retry_after;
  if (typeof retry === 'number') return `${text} Try again in ${retry} seconds.`;
  return text;
}
