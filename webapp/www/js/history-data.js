// The history screen's data: the database's points joined with the collector's
// real-time samples on one time axis, so that a chart runs up to now. Pure
// functions, no DOM.

// `times`/`values` from `start` on, in buckets of `size` seconds that begin on
// multiples of `size`: {times, avg, min, max}.
export function bucketSamples(times, values, size, start) {
  const out = {times: [], avg: [], min: [], max: []};
  let i = 0;
  while (i < times.length && times[i] < start) i += 1;
  while (i < times.length) {
    const begin = Math.floor(times[i] / size) * size;
    let sum = 0;
    let count = 0;
    let low = Infinity;
    let high = -Infinity;
    for (; i < times.length && times[i] < begin + size; i += 1) {
      sum += values[i];
      count += 1;
      low = Math.min(low, values[i]);
      high = Math.max(high, values[i]);
    }
    out.times.push(begin);
    out.avg.push(sum / count);
    out.min.push(low);
    out.max.push(high);
  }
  return out;
}

// Joins, for each of `ids`, the points of `history` (Map id → {times, avg, min,
// max}, one point a `step`) with the samples of `live` (Map id → {times,
// values}) after `from`, in buckets of `bucket` seconds. Where the buckets are
// finer than the step, the samples take over from the first of them; else they
// follow each series' last point. Returns {times, series: Map id → {avg, min,
// max}}, null where a series has no point and across a hole of over two steps,
// so that the line breaks there.
export function joinSeries(ids, history, step, live, bucket, from) {
  const finer = bucket < step;
  let liveStart = Infinity;
  for (const id of ids) {
    const first = live.get(id)?.times.find((time) => time >= from);
    if (first !== undefined) liveStart = Math.min(liveStart, first);
  }
  const shared = Math.ceil(liveStart / bucket) * bucket;
  const pieces = new Map();
  const all = new Set();
  for (const id of ids) {
    const points = history.get(id) ?? {times: [], avg: [], min: [], max: []};
    const end = points.times.length ? points.times.at(-1) + step : from;
    const cut = finer ? shared : end;
    const kept = points.times.filter((time) => time + step <= cut).length;
    const samples = live.get(id) ?? {times: [], values: []};
    const tail = bucketSamples(samples.times, samples.values, finer ? bucket : step, Math.max(cut, from));
    const piece = {};
    for (const key of ['times', 'avg', 'min', 'max']) piece[key] = points[key].slice(0, kept).concat(tail[key]);
    pieces.set(id, piece);
    for (const time of piece.times) all.add(time);
  }
  const times = [];
  for (const time of [...all].sort((a, b) => a - b)) {
    if (times.length && time - times.at(-1) > 2 * step) times.push(times.at(-1) + step);
    times.push(time);
  }
  const index = new Map(times.map((time, i) => [time, i]));
  const series = new Map();
  for (const [id, piece] of pieces) {
    const arrays = {avg: [], min: [], max: []};
    for (const key of ['avg', 'min', 'max']) {
      arrays[key] = new Array(times.length).fill(null);
      piece.times.forEach((time, i) => (arrays[key][index.get(time)] = piece[key][i]));
    }
    series.set(id, arrays);
  }
  return {times, series};
}

const kEmpty = {avg: [], min: [], max: []};

// The sum of several joined series, point by point; null only where all are.
export function sumSeries(list, length) {
  const out = {};
  for (const key of ['avg', 'min', 'max']) {
    out[key] = Array.from({length}, (unused, i) => {
      let total = null;
      for (const one of list) {
        if (one[key][i] !== null && one[key][i] !== undefined) total = (total ?? 0) + one[key][i];
      }
      return total;
    });
  }
  return out;
}

// 100 less a percentage (busy from idle): its minimum comes from the maximum.
export function complement(one = kEmpty) {
  const flip = (values) => values.map((value) => (value === null ? null : 100 - value));
  return {avg: flip(one.avg), min: flip(one.max), max: flip(one.min)};
}
