// The web API's result codes that the page acts on (rather than only shows),
// one name each. Every code's words for the user are in messages.ts.

export const HostCode = {
  Unknown: 100,
  BadRequest: 101,
  NotPermitted: 105,
  SessionExpired: 106,
  NotSignedIn: 119,
  Parameter: 120,
  WrongPassword: 400,
  SignInThrottled: 407,
} as const;
