// The app's frame: sign-in, the navigation between screens and the end of a
// session. Each screen is a module of views/ that is loaded when first shown:
// mount(container) returns {unmount()}.

import {ApiError, onSessionEnd, signIn, signOut, signedInAccount} from './api.js';
import {errorText} from './errors.js';
import {define, loadSystemTexts, t} from './i18n.js';
import {h, showStatus} from './ui.js';

define({
  enu: {
    'app.title': 'KOVA Resource Monitor',
    'nav.label': 'Screens',
    'nav.overview': 'Overview',
    'nav.history': 'History',
    'nav.services': 'Services',
    'nav.log': 'Event log',
    'nav.rules': 'Rules',
    'nav.settings': 'Settings',
    'signin.heading': 'Sign in',
    'signin.account': 'Account',
    'signin.password': 'Password',
    'signin.submit': 'Sign in',
    'signin.expired': 'Your session has expired. Please sign in again.',
    'signin.signed_out': 'You have signed out.',
    'signout': 'Sign out',
    'screen.failed': 'This screen could not be loaded.',
  },
  ger: {
    'app.title': 'KOVA Ressourcenmonitor',
    'nav.label': 'Ansichten',
    'nav.overview': 'Übersicht',
    'nav.history': 'Verlauf',
    'nav.services': 'Dienste',
    'nav.log': 'Ereignisprotokoll',
    'nav.rules': 'Regeln',
    'nav.settings': 'Einstellungen',
    'signin.heading': 'Anmelden',
    'signin.account': 'Konto',
    'signin.password': 'Passwort',
    'signin.submit': 'Anmelden',
    'signin.expired': 'Ihre Sitzung ist abgelaufen. Bitte melden Sie sich erneut an.',
    'signin.signed_out': 'Sie haben sich abgemeldet.',
    'signout': 'Abmelden',
    'screen.failed': 'Diese Ansicht konnte nicht geladen werden.',
  },
});

// The screens, in the order of the navigation.
const kScreens = [
  {id: 'overview', load: () => import('./views/overview.js')},
  {id: 'history', load: () => import('./views/history.js')},
  {id: 'services', load: () => import('./views/services.js')},
  {id: 'log', load: () => import('./views/log.js')},
  {id: 'rules', load: () => import('./views/rules.js')},
  {id: 'settings', load: () => import('./views/settings.js')},
];

const main = document.getElementById('main');
const nav = document.getElementById('nav');
const signOutButton = document.getElementById('sign-out');
const accountLabel = document.getElementById('account');
let current = null;  // {id, view}
let showing = 0;     // counts screen changes, so that a slow load can't show a left screen

function screenOf(hash) {
  const id = hash.replace(/^#\/?/, '');
  return kScreens.find((screen) => screen.id === id) ?? kScreens[0];
}

function leaveScreen() {
  showing += 1;
  if (current?.view?.unmount) current.view.unmount();
  current = null;
}

async function showScreen() {
  if (!signedInAccount()) return;
  const screen = screenOf(location.hash);
  leaveScreen();
  const mine = showing;
  for (const link of nav.querySelectorAll('a')) {
    if (link.dataset.screen === screen.id) link.setAttribute('aria-current', 'page');
    else link.removeAttribute('aria-current');
  }
  const heading = h('h2', {id: 'screen-heading', tabindex: '-1'}, t(`nav.${screen.id}`));
  const container = h('section', {class: `screen screen-${screen.id}`, 'aria-labelledby': 'screen-heading'},
    heading);
  main.replaceChildren(container);
  // A new screen is announced and the keyboard starts from its top.
  heading.focus({preventScroll: true});
  try {
    const module = await screen.load();
    if (mine !== showing) return;
    const view = await module.mount(container);
    // The user went on while this screen was being made: it goes at once.
    if (mine !== showing) {
      view?.unmount?.();
      return;
    }
    current = {id: screen.id, view};
  } catch (error) {
    if (mine !== showing) return;
    console.debug('screen failed', error);
    container.append(h('p', {class: 'error', role: 'alert'}, t('screen.failed')));
  }
}

function showNavigation() {
  nav.setAttribute('aria-label', t('nav.label'));
  nav.replaceChildren(...kScreens.map((screen) =>
    h('a', {href: `#/${screen.id}`, dataset: {screen: screen.id}}, t(`nav.${screen.id}`))));
  nav.hidden = false;
  signOutButton.textContent = t('signout');
  signOutButton.hidden = false;
  accountLabel.textContent = signedInAccount();
  accountLabel.hidden = false;
}

function showSignIn(message = '') {
  leaveScreen();
  nav.hidden = true;
  signOutButton.hidden = true;
  accountLabel.hidden = true;
  const note = h('p', {class: 'signin-note', role: 'alert'}, message);
  const account = h('input', {id: 'signin-account', name: 'account', autocomplete: 'username', required: true});
  const password = h('input', {id: 'signin-password', name: 'password', type: 'password',
                               autocomplete: 'current-password', required: true});
  const submit = h('button', {class: 'primary'}, t('signin.submit'));
  const form = h('form', {class: 'signin', onsubmit: async (event) => {
    event.preventDefault();
    submit.disabled = true;
    note.textContent = '';
    try {
      await signIn(account.value, password.value);
      password.value = '';
      showNavigation();
      await showScreen();
    } catch (error) {
      note.textContent = error instanceof ApiError ? errorText(error) : String(error);
      password.select();
    } finally {
      submit.disabled = false;
    }
  }},
  h('h2', {}, t('signin.heading')),
  h('label', {for: 'signin-account'}, t('signin.account')), account,
  h('label', {for: 'signin-password'}, t('signin.password')), password,
  submit, note);
  main.replaceChildren(form);
  account.focus();
}

onSessionEnd((reason) => {
  showStatus('');
  showSignIn(t(`signin.${reason}`));
});
signOutButton.addEventListener('click', () => signOut());
window.addEventListener('hashchange', showScreen);

document.title = t('app.title');
document.querySelector('.brand').textContent = t('app.title');
await loadSystemTexts();
showSignIn();
