// The log screen.

import {h} from '../ui.js';

export function mount(container) {
  container.append(h('p', {}, 'log'));
  return {unmount() {}};
}
