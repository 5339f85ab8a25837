// Small DOM helpers shared by the screens.

import {signedInAccount} from './api.js';
import {define, t} from './i18n.js';

define({
  enu: {'ui.ok': 'OK', 'ui.cancel': 'Cancel'},
  ger: {'ui.ok': 'OK', 'ui.cancel': 'Abbrechen'},
});

// An element: h('button', {type: 'button', onclick}, 'Text'). Properties that
// start with "on" become listeners, "class" the class name, "dataset" data-*
// attributes; null and false children are left out.
export function h(tag, props = {}, ...children) {
  const element = document.createElement(tag);
  for (const [name, value] of Object.entries(props ?? {})) {
    if (value === null || value === undefined || value === false) continue;
    if (name.startsWith('on')) element.addEventListener(name.slice(2), value);
    else if (name === 'class') element.className = value;
    else if (name === 'dataset') Object.assign(element.dataset, value);
    else if (name in element && typeof value !== 'string') element[name] = value;
    else element.setAttribute(name, value === true ? '' : value);
  }
  for (const child of children.flat()) {
    if (child === null || child === undefined || child === false) continue;
    element.append(child instanceof Node ? child : String(child));
  }
  return element;
}

let statusTimer = 0;

// Shows `text` in the status line for a while; errors stay until the next text.
export function showStatus(text, {error = false} = {}) {
  // A call that failed because the session ended has said so at the sign-in.
  if (error && !signedInAccount()) return;
  const status = document.getElementById('status');
  clearTimeout(statusTimer);
  status.textContent = text;
  status.classList.toggle('error', error);
  status.classList.toggle('shown', Boolean(text));
  if (!error && text) statusTimer = setTimeout(() => status.classList.remove('shown'), 4000);
}

// Asks `question` in a modal dialog. Resolves to true when confirmed.
export function confirmDialog(question, confirmLabel = t('ui.ok')) {
  return new Promise((resolve) => {
    const dialog = h('dialog', {class: 'confirm', 'aria-label': question},
      h('p', {}, question),
      h('form', {method: 'dialog', class: 'buttons'},
        h('button', {value: 'cancel', class: 'plain'}, t('ui.cancel')),
        h('button', {value: 'ok', class: 'primary'}, confirmLabel)));
    dialog.addEventListener('close', () => {
      resolve(dialog.returnValue === 'ok');
      dialog.remove();
    });
    document.body.append(dialog);
    dialog.showModal();
  });
}

// Runs `tick` every `interval` ms while the page is shown, never two at once.
// A hidden page stops it; when the page is shown again it ticks at once, and
// the tick catches up (it asks for what came since its last answer).
// Returns {stop()}.
export function startPolling(tick, interval = 1000) {
  let timer = 0;
  let running = false;
  let stopped = false;
  async function run() {
    clearTimeout(timer);
    if (stopped || document.hidden || running) return;
    running = true;
    try {
      await tick();
    } catch (error) {
      console.debug('poll failed', error);
    }
    running = false;
    if (!stopped && !document.hidden) timer = setTimeout(run, interval);
  }
  const onVisibility = () => (document.hidden ? clearTimeout(timer) : run());
  document.addEventListener('visibilitychange', onVisibility);
  run();
  return {
    stop() {
      stopped = true;
      clearTimeout(timer);
      document.removeEventListener('visibilitychange', onVisibility);
    },
  };
}
