// Puts the web app into a static folder: its own files, uPlot from
// node_modules, and the platform's string tables as one JSON file a language.
//   node build_www.mjs WWW_SOURCE TEXTS_DIR OUTPUT
import {cpSync, existsSync, mkdirSync, readFileSync, readdirSync, rmSync, writeFileSync} from 'node:fs';
import {dirname, join} from 'node:path';
import {fileURLToPath} from 'node:url';

const [source, textsDir, output] = process.argv.slice(2);
if (!output) {
  console.error('usage: node build_www.mjs WWW_SOURCE TEXTS_DIR OUTPUT');
  process.exit(2);
}
const uplot = join(dirname(fileURLToPath(import.meta.url)), '..', 'node_modules', 'uplot', 'dist');
if (!existsSync(uplot)) {
  console.error(`build_www: ${uplot} is missing; run scripts/setup (npm ci in webapp/)`);
  process.exit(1);
}

// Reads an ini string table: [section] lines and key = "text" lines.
function parseIni(text) {
  const sections = {};
  let current = null;
  for (const raw of text.split('\n')) {
    const line = raw.trim();
    if (line === '' || line.startsWith(';') || line.startsWith('#')) continue;
    const section = /^\[(.+)\]$/.exec(line);
    if (section) {
      current = sections[section[1]] ??= {};
      continue;
    }
    const entry = /^([^=\s]+)\s*=\s*"(.*)"$/.exec(line);
    if (entry && current) current[entry[1]] = entry[2];
  }
  return sections;
}

rmSync(output, {recursive: true, force: true});
cpSync(source, output, {recursive: true});
mkdirSync(join(output, 'lib'), {recursive: true});
cpSync(join(uplot, 'uPlot.iife.min.js'), join(output, 'lib', 'uPlot.iife.min.js'));
cpSync(join(uplot, 'uPlot.min.css'), join(output, 'lib', 'uPlot.min.css'));
mkdirSync(join(output, 'texts'), {recursive: true});
for (const language of readdirSync(textsDir)) {
  const sections = {};
  for (const file of readdirSync(join(textsDir, language)).filter((name) => name.endsWith('.ini')).sort()) {
    Object.assign(sections, parseIni(readFileSync(join(textsDir, language, file), 'utf8')));
  }
  writeFileSync(join(output, 'texts', `${language}.json`), JSON.stringify(sections));
}
