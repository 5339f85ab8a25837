// The services screen.

import {h} from '../ui.js';

export function mount(container) {
  container.append(h('p', {}, 'services'));
  return {unmount() {}};
}
