// The overview screen.

import {h} from '../ui.js';

export function mount(container) {
  container.append(h('p', {}, 'overview'));
  return {unmount() {}};
}
