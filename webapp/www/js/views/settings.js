// The settings screen.

import {h} from '../ui.js';

export function mount(container) {
  container.append(h('p', {}, 'settings'));
  return {unmount() {}};
}
