// Calls of the host's web APIs. The session travels in the host's HttpOnly
// cookie; its token is kept here, in page memory only, and sent with every call.

const kEntry = '/webapi/entry.cgi';

// Host codes the app reacts to.
const kNotSignedIn = 106;
const kBadToken = 107;

let token = '';
let account = '';
const sessionEndListeners = [];

// A failed call: the host's or the module's error code and its data.
export class ApiError extends Error {
  constructor(code, errors, message) {
    super(message ?? `error ${code}`);
    this.code = code;
    this.errors = errors ?? null;
  }
}

export function signedInAccount() {
  return account;
}

// Calls `listener(reason)` when the session ends on its own ("expired") or the
// user signs out ("signed_out").
export function onSessionEnd(listener) {
  sessionEndListeners.push(listener);
}

function endSession(reason) {
  if (!token) return;
  token = '';
  account = '';
  for (const listener of sessionEndListeners) listener(reason);
}

// Every value goes as JSON, so that a text that looks like a number stays text.
function formBody(api, method, params) {
  const body = new URLSearchParams({api, version: '1', method});
  for (const [name, value] of Object.entries(params)) {
    if (value !== undefined) body.append(name, JSON.stringify(value));
  }
  return body;
}

// Posts `body` with the session's token (or `sessionToken`).
async function post(body, sessionToken = token) {
  try {
    return await fetch(kEntry, {
      method: 'POST',
      body,
      headers: sessionToken ? {'X-KOVA-Token': sessionToken} : {},
      credentials: 'same-origin',
    });
  } catch {
    throw new ApiError(0, null, 'the server can not be reached');
  }
}

async function answerOf(reply) {
  let answer;
  try {
    answer = await reply.json();
  } catch {
    throw new ApiError(0, null, `the server answered HTTP ${reply.status} without JSON`);
  }
  if (answer.success === true) return answer.data ?? null;
  const code = answer.error?.code ?? 0;
  if (code === kNotSignedIn || code === kBadToken) endSession('expired');
  throw new ApiError(code, answer.error?.errors, answer.error?.errors?.reason);
}

// Calls `method` of `api`, version 1. Resolves to the answer's data; rejects
// with an ApiError (code 0 when the server can't be reached or its answer is no
// JSON). A call that finds the session gone ends it for the whole app.
export async function call(api, method, params = {}) {
  return answerOf(await post(formBody(api, method, params)));
}

// Signs in. Resolves to the account on success, rejects with an ApiError.
export async function signIn(name, password) {
  const body = new URLSearchParams({api: 'KOVA.API.Auth', version: '1', method: 'login'});
  body.append('account', name);
  body.append('password', password);
  const data = await answerOf(await post(body));
  token = data.token;
  account = data.account ?? name;
  return account;
}

// Signs out. The app ends the session first, so that a poll that meets the
// ended session on the server can't report it as expired.
export async function signOut() {
  const ended = token;
  endSession('signed_out');
  // The session is gone for the app either way.
  await post(formBody('KOVA.API.Auth', 'logout', {}), ended).catch(() => {});
}

// Calls a method that answers with a file, and hands the file to the browser
// under the name the server gives in Content-Disposition. Rejects with an
// ApiError when the server answers with an error instead.
export async function download(api, method, params = {}) {
  const reply = await post(formBody(api, method, params));
  const disposition = reply.headers.get('Content-Disposition') ?? '';
  if (!/attachment/i.test(disposition)) return answerOf(reply);
  const quoted = /filename="([^"]*)"/i.exec(disposition);
  const name = decodeURIComponent(quoted ? quoted[1] : 'download');
  const url = URL.createObjectURL(await reply.blob());
  const link = document.createElement('a');
  link.href = url;
  link.download = name;
  document.body.append(link);
  link.click();
  link.remove();
  setTimeout(() => URL.revokeObjectURL(url), 10000);
  return name;
}
