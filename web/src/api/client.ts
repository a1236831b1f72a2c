// The page's only way to the web API (docs/http-api.md). Every call is a POST
// to entry.cgi carrying the session cookie, which the browser adds and no
// script can read, and the session's token in the X-KIVO-Token header. The
// token lives in this object only: a reloaded page asks for it again
// (`restoreSession`) instead of keeping it in any storage.

import { HostCode } from './codes';

export const kEndpoint = '/webapi/entry.cgi';

// Signing in and out, and the session the cookie carries.
const kAuth = 'KIVO.API.Auth';

// Why a call failed: the API's own code and details, or kNoAnswer when no
// answer came back at all (the network, or a body that is not JSON).
export interface ApiFailure {
  code: number;
  errors?: Record<string, unknown>;
}

export type Result<T> = { ok: true; data: T } | { ok: false; error: ApiFailure };

// Not a code of the API: the page's own mark for "no answer came back".
export const kNoAnswer = 0;

export type ParamValue = string | number | boolean | null | object | undefined;
export type Params = Record<string, ParamValue>;

export interface SessionInfo {
  account: string;
  administrator: boolean;
}

// Every value goes as JSON, strings quoted too: the API decodes a bare `true`
// or `5` as a boolean or a number, so a name that looks like one would
// otherwise change type on the way.
function encode(api: string, method: string, version: number, params: Params): URLSearchParams {
  const form = new URLSearchParams({ api, method, version: String(version) });
  for (const [name, value] of Object.entries(params)) {
    if (value !== undefined) form.append(name, JSON.stringify(value));
  }
  return form;
}

function failure(code: number, errors?: Record<string, unknown>): Result<never> {
  return { ok: false, error: { code, errors } };
}

// Turns the API's answer into a Result; anything else is kNoAnswer.
function parseAnswer<T>(text: string): Result<T> {
  try {
    const answer = JSON.parse(text) as {
      success?: boolean;
      data?: T;
      error?: { code?: number; errors?: Record<string, unknown> };
    };
    if (answer.success === true) return { ok: true, data: answer.data as T };
    if (typeof answer.error?.code === 'number') return failure(answer.error.code, answer.error.errors);
  } catch {
    // not JSON: a proxy's error page, a cut connection
  }
  return failure(kNoAnswer);
}

export class Api {
  private token = '';
  // Called when an answer says the session is gone, so the page can ask the
  // user to sign in again instead of showing the error on every panel.
  onSessionEnded: (code: number) => void = () => {};

  // `keepalive` lets the request outlive the page: a clean-up sent as the
  // page is left, an operation the user started just before a reload.
  async call<T = unknown>(api: string, method: string, version: number, params: Params = {}, keepalive = false): Promise<Result<T>> {
    let text: string;
    try {
      text = await (await this.post(api, method, version, params, keepalive)).text();
    } catch {
      return failure(kNoAnswer);
    }
    return this.checked(parseAnswer<T>(text));
  }

  // A method that answers a file to save (an export): the file, or the
  // API's failure when it answered that instead. Only a file comes as an
  // attachment.
  async download(api: string, method: string, version: number, params: Params = {}): Promise<Result<Blob>> {
    try {
      const response = await this.post(api, method, version, params);
      if (response.ok && /^attachment/i.test(response.headers.get('Content-Disposition') ?? '')) return { ok: true, data: await response.blob() };
      const answer = parseAnswer<unknown>(await response.text());
      return this.checked(answer.ok ? failure(kNoAnswer) : answer);
    } catch {
      return failure(kNoAnswer);
    }
  }

  private post(api: string, method: string, version: number, params: Params, keepalive = false): Promise<Response> {
    return fetch(kEndpoint, {
      method: 'POST',
      credentials: 'same-origin',
      headers: { 'X-KIVO-Token': this.token },
      body: encode(api, method, version, params),
      keepalive,
    });
  }

  // Posts `file` as multipart/form-data with `fields` before it, reporting
  // the bytes sent; `abort` cancels the transfer; `part` names the file's
  // part (a key file goes as "upload_keyring"). fetch cannot report upload
  // progress, hence XMLHttpRequest.
  upload<T = unknown>(
    api: string,
    method: string,
    version: number,
    fields: Params,
    file: File,
    onProgress: (sent: number, total: number) => void,
    abort?: AbortSignal,
    part = 'file',
  ): Promise<Result<T>> {
    const query = new URLSearchParams({ api, method, version: String(version) });
    const form = new FormData();
    for (const [name, value] of Object.entries(fields)) {
      if (value !== undefined) form.append(name, JSON.stringify(value));
    }
    form.append(part, file, file.name);
    return new Promise((resolve) => {
      const xhr = new XMLHttpRequest();
      xhr.open('POST', `${kEndpoint}?${query}`);
      xhr.setRequestHeader('X-KIVO-Token', this.token);
      xhr.upload.onprogress = (e) => onProgress(e.loaded, e.lengthComputable ? e.total : file.size);
      xhr.onload = () => resolve(this.checked(parseAnswer<T>(xhr.responseText)));
      xhr.onerror = xhr.onabort = () => resolve(failure(kNoAnswer));
      abort?.addEventListener('abort', () => xhr.abort());
      xhr.send(form);
    });
  }

  // The address of a method that the browser loads by URL (icons,
  // screenshots): those are exempt from the token, the cookie is enough.
  url(api: string, method: string, version: number, params: Params = {}): string {
    return `${kEndpoint}?${encode(api, method, version, params)}`;
  }

  async signIn(account: string, passwd: string): Promise<Result<SessionInfo>> {
    const signedIn = await this.call<{ token: string }>(kAuth, 'login', 1, { account, passwd });
    if (!signedIn.ok) return signedIn;
    this.token = signedIn.data.token;
    return this.restoreSession();
  }

  // Picks up the session that the cookie carries, if any.
  async restoreSession(): Promise<Result<SessionInfo>> {
    const session = await this.call<SessionInfo & { token: string }>(kAuth, 'session', 1);
    if (!session.ok) return session;
    this.token = session.data.token;
    return { ok: true, data: { account: session.data.account, administrator: session.data.administrator } };
  }

  async signOut(): Promise<Result<unknown>> {
    const result = await this.call(kAuth, 'logout', 1);
    this.token = '';
    return result;
  }

  private checked<T>(result: Result<T>): Result<T> {
    if (!result.ok && this.token !== '' && isSessionGone(result.error.code)) {
      this.token = '';
      this.onSessionEnded(result.error.code);
    }
    return result;
  }
}

export function isSessionGone(code: number): boolean {
  return code === HostCode.NotSignedIn || code === HostCode.SessionExpired;
}
