// Time charts over uPlot: lines (or average lines with min/max bands), a
// threshold line, and performance events drawn as markers whose text shows on
// hover. Times are Unix seconds.

import {formatAxisTimes, formatTime, formatValue} from './format.js';
import {define, t} from './i18n.js';

define({
  enu: {'chart.time': 'Time', 'chart.min': '{label} min', 'chart.max': '{label} max'},
  ger: {'chart.time': 'Zeit', 'chart.min': '{label} Min.', 'chart.max': '{label} Max.'},
});

// The colour of each event level's markers: the canvas's copy of the style
// sheet's --info, --warning and --danger.
const kLevelColors = {Info: '#2f6fba', Warning: '#d48a00', Critical: '#c62828'};

const kPalette = ['#1f77b4', '#e4572e', '#29a35a', '#9c4fd1', '#d4a017', '#17a2b8',
                         '#8c564b', '#e377c2', '#555f6d', '#7fa31a'];

const kMarkerHitPixels = 6;

// Draws each marker of `markers()` as a dashed line with a triangle on top.
function markerPlugin(markers, tooltip) {
  function draw(u) {
    const {ctx} = u;
    const {top, height} = u.bbox;
    const [from, to] = [u.scales.x.min, u.scales.x.max];
    ctx.save();
    for (const marker of markers()) {
      if (marker.time < from || marker.time > to) continue;
      const x = Math.round(u.valToPos(marker.time, 'x', true));
      ctx.strokeStyle = ctx.fillStyle = kLevelColors[marker.level] ?? kLevelColors.Info;
      ctx.lineWidth = devicePixelRatio;
      ctx.setLineDash([4 * devicePixelRatio, 3 * devicePixelRatio]);
      ctx.beginPath();
      ctx.moveTo(x, top);
      ctx.lineTo(x, top + height);
      ctx.stroke();
      const size = 5 * devicePixelRatio;
      ctx.setLineDash([]);
      ctx.beginPath();
      ctx.moveTo(x - size, top);
      ctx.lineTo(x + size, top);
      ctx.lineTo(x, top + size * 1.6);
      ctx.closePath();
      ctx.fill();
    }
    ctx.restore();
  }
  function hover(u) {
    const left = u.cursor.left;
    if (left === undefined || left < 0) {
      tooltip.hidden = true;
      return;
    }
    const near = markers().filter((marker) => {
      const x = u.valToPos(marker.time, 'x');
      return Math.abs(x - left) <= kMarkerHitPixels;
    });
    if (near.length === 0) {
      tooltip.hidden = true;
      return;
    }
    tooltip.replaceChildren(...near.slice(0, 5).map((marker) => {
      const line = document.createElement('div');
      line.className = `marker-text level-${marker.level}`;
      line.textContent = `${formatTime(marker.time)} · ${marker.text}`;
      return line;
    }));
    tooltip.hidden = false;
    const width = u.over.clientWidth;
    tooltip.style.left = `${Math.min(Math.max(0, left - 100), Math.max(0, width - 220))}px`;
  }
  return {hooks: {draw, setCursor: hover}};
}

// A horizontal line at `threshold()`, when it is a number.
function thresholdPlugin(threshold) {
  return {
    hooks: {
      draw(u) {
        const value = threshold();
        if (!Number.isFinite(value)) return;
        const y = Math.round(u.valToPos(value, 'y', true));
        const {ctx} = u;
        ctx.save();
        ctx.strokeStyle = '#c62828';
        ctx.lineWidth = 2 * devicePixelRatio;
        ctx.setLineDash([8 * devicePixelRatio, 4 * devicePixelRatio]);
        ctx.beginPath();
        ctx.moveTo(u.bbox.left, y);
        ctx.lineTo(u.bbox.left + u.bbox.width, y);
        ctx.stroke();
        ctx.restore();
      },
    },
  };
}

// Makes a chart in `container`.
//   unit: the values' unit ("%", "B", "B/s", ...), for the axis and legend;
//   series: [{label, color}]; with bands, each is drawn from three arrays
//     (average, minimum, maximum);
//   height (200), yRange ([min, max] or null for automatic, never below 0),
//   onSelect(from, to): called when the user drags over a time range;
//   live: the legend shows the newest values while the cursor is off the chart.
// Returns {setData(times, arrays), setMarkers(list), setThreshold(value),
// setWindow(from, to), destroy()}.
export function createChart(container, options) {
  const {unit, series, height = 200, bands = false, yRange = null, onSelect = null, live = false} = options;
  let markers = [];
  let threshold = null;
  let window = null;
  const wrapper = document.createElement('div');
  wrapper.className = 'chart';
  const tooltip = document.createElement('div');
  tooltip.className = 'chart-tooltip';
  tooltip.hidden = true;
  wrapper.append(tooltip);
  container.append(wrapper);

  // With `live`, a legend without a cursor index takes the series' newest value.
  const newest = (u, v, index, idx) => {
    if (!live || idx !== null) return v;
    const values = u.data[index];
    for (let at = values.length - 1; at >= 0 && at >= values.length - 5; at -= 1) {
      if (values[at] !== null) return values[at];
    }
    return null;
  };
  const plotSeries = [{label: t('chart.time'), value: (u, v, s, idx) => {
    const time = newest(u, v, s, idx);
    return time === null || time === undefined ? '–' : formatTime(time);
  }}];
  const plotBands = [];
  series.forEach((one, index) => {
    const color = one.color ?? kPalette[index % kPalette.length];
    const line = {label: one.label, stroke: color, width: 1.5, points: {show: false},
                  value: (u, v, s, idx) => formatValue(newest(u, v, s, idx), unit)};
    if (!bands) {
      plotSeries.push(line);
      return;
    }
    const first = plotSeries.length;
    plotSeries.push(line,
                    {label: t('chart.min', {label: one.label}), stroke: 'transparent', points: {show: false},
                     value: (u, v) => formatValue(v, unit)},
                    {label: t('chart.max', {label: one.label}), stroke: 'transparent', points: {show: false},
                     value: (u, v) => formatValue(v, unit)});
    plotBands.push({series: [first + 2, first + 1], fill: `${color}33`});
  });

  const range = (u, min, max) => {
    if (yRange) return [yRange[0], Math.max(yRange[1], max ?? 0)];
    const top = Math.max(max ?? 0, Number.isFinite(threshold) ? threshold : 0);
    return [0, top > 0 ? top * 1.1 : 1];
  };
  const plot = new uPlot({
    width: Math.max(200, container.clientWidth),
    height,
    series: plotSeries,
    bands: plotBands,
    scales: {
      x: {time: true, range: (u, min, max) => (window ? window : [min, max])},
      y: {range},
    },
    axes: [{space: 80, values: (u, ticks, axis, space, step) => formatAxisTimes(ticks, step)}, {values: (u, values) => values.map((v) => formatValue(v, unit)), size: 80}],
    legend: {live: true},
    cursor: {drag: {x: Boolean(onSelect), y: false, setScale: false}},
    plugins: [markerPlugin(() => markers, tooltip), thresholdPlugin(() => threshold)],
    hooks: onSelect ? {
      setSelect: [(u) => {
        if (u.select.width < 5) return;
        const from = u.posToVal(u.select.left, 'x');
        const to = u.posToVal(u.select.left + u.select.width, 'x');
        u.setSelect({left: 0, width: 0}, false);
        onSelect(Math.floor(from), Math.ceil(to));
      }],
    } : {},
  }, [[], ...plotSeries.slice(1).map(() => [])], wrapper);

  const resize = new ResizeObserver(() => {
    const width = Math.max(200, container.clientWidth);
    if (width !== plot.width) plot.setSize({width, height});
  });
  resize.observe(container);

  return {
    setData(times, arrays) {
      plot.setData([times, ...arrays]);
    },
    setMarkers(list) {
      markers = list;
      plot.redraw(false, false);
    },
    setThreshold(value) {
      threshold = value;
      plot.setData(plot.data, true);
    },
    setWindow(from, to) {
      window = [from, to];
      plot.setScale('x', {min: from, max: to});
    },
    destroy() {
      resize.disconnect();
      plot.destroy();
      wrapper.remove();
    },
  };
}
