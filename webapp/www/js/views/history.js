// The history screen.

import {h} from '../ui.js';

export function mount(container) {
  container.append(h('p', {}, 'history'));
  return {unmount() {}};
}
