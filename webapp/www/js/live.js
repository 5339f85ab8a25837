// Real-time samples of many series on one time axis, as uPlot takes them: the
// times, and for each series an array of the same length with null where it
// had no sample. The arrays are changed in place, so a chart keeps its
// references; old samples are cut from the front, so memory stays flat.

// The index of the first element of sorted `list` that is not below `value`.
function lowerBound(list, value) {
  let low = 0;
  let high = list.length;
  while (low < high) {
    const middle = (low + high) >>> 1;
    if (list[middle] < value) low = middle + 1;
    else high = middle;
  }
  return low;
}

// Drops the first `count` elements of `list`. shift() moves the array's start
// instead of its elements, which makes the second-by-second cut cheap.
function cut(list, count) {
  if (count > 64) list.splice(0, count);
  else for (let i = 0; i < count; i += 1) list.shift();
}

// The times of every answered series after `after`, sorted, each once.
function newTimes(answered, after) {
  let first = null;
  let same = true;
  for (const one of answered.values()) {
    if (one.times.length === 0) continue;
    if (first === null) first = one.times;
    else if (same && (one.times.length !== first.length || one.times.at(-1) !== first.at(-1) ||
                      one.times[0] !== first[0])) same = false;
  }
  if (first === null) return [];
  // One collector cycle gives every series the same seconds: the usual case.
  const union = same ? first : [...new Set([...answered.values()].flatMap((one) => one.times))].sort((a, b) => a - b);
  const start = lowerBound(union, after + 1);
  return start === 0 ? union : union.slice(start);
}

export class LiveStore {
  times = [];
  #series = new Map();  // id → {values, transform}
  #ids = [];
  #pending = new Set();  // ids added while samples were held: their past is still missing

  get ids() {
    return this.#ids;
  }

  get newest() {
    return this.times.length ? this.times[this.times.length - 1] : 0;
  }

  get oldest() {
    return this.times.length ? this.times[0] : 0;
  }

  // The ids that were added after the first samples and wait for `fill`.
  get pending() {
    return [...this.#pending];
  }

  // The values of `id`, the same array for as long as the id is kept.
  values(id) {
    return this.#series.get(id)?.values;
  }

  // Whether a sample of `id` is held.
  holds(id) {
    return this.#series.get(id)?.values.some((value) => value !== null) ?? false;
  }

  // Keeps the series of `wanted` ([{id, transform}]) and drops the others. A new
  // one starts with null at every time held.
  keep(wanted) {
    const ids = new Set(wanted.map((one) => one.id));
    for (const id of this.#series.keys()) {
      if (!ids.has(id)) {
        this.#series.delete(id);
        this.#pending.delete(id);
      }
    }
    for (const {id, transform} of wanted) {
      if (this.#series.has(id)) continue;
      this.#series.set(id, {values: new Array(this.times.length).fill(null), transform});
      if (this.times.length) this.#pending.add(id);
    }
    this.#ids = [...this.#series.keys()];
  }

  // Appends the samples of `answered` (Map id → {times, values}) that are newer
  // than the newest held; a series without a sample at a time gets null.
  // Answers how many times were added.
  append(answered) {
    const times = newTimes(answered, this.newest);
    if (times.length === 0) return 0;
    for (const [id, {values, transform}] of this.#series) {
      const one = answered.get(id);
      let at = one ? lowerBound(one.times, times[0]) : 0;
      for (const time of times) {
        while (one && at < one.times.length && one.times[at] < time) at += 1;
        const found = one && one.times[at] === time;
        values.push(found ? (transform ? transform(one.values[at]) : one.values[at]) : null);
      }
    }
    for (const time of times) this.times.push(time);
    return times.length;
  }

  // Puts the samples of `answered` for the pending ids at the times held.
  fill(answered) {
    for (const id of this.#pending) {
      const one = answered.get(id);
      const series = this.#series.get(id);
      if (!one || !series) continue;
      one.times.forEach((time, index) => {
        const at = lowerBound(this.times, time);
        if (this.times[at] !== time) return;
        const value = one.values[index];
        series.values[at] = series.transform ? series.transform(value) : value;
      });
    }
    this.#pending.clear();
  }

  // Drops the samples before `oldest`; answers how many.
  trim(oldest) {
    const count = lowerBound(this.times, oldest);
    if (count === 0) return 0;
    cut(this.times, count);
    for (const {values} of this.#series.values()) cut(values, count);
    return count;
  }
}
