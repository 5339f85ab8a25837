// The rules screen.

import {h} from '../ui.js';

export function mount(container) {
  container.append(h('p', {}, 'rules'));
  return {unmount() {}};
}
