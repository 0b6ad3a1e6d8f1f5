#!/usr/bin/env node
// The one list of the add-on's C++ sources, read by binding.gyp and by the unit-test build.
//   node scripts/sources.js addon|core [linux|win32]
// "addon" is every source; "core" leaves out native/interface.cc, which needs Node's headers.
// Each platform builds only its own folder below native/platform.
'use strict';
const fs = require('fs');
const path = require('path');

const root = path.resolve(__dirname, '..');
const [kind = 'addon', platform = process.platform] = process.argv.slice(2);
const other = platform === 'win32' ? 'linux' : 'windows';

function walk(dir) {
  return fs.readdirSync(path.join(root, dir), { withFileTypes: true })
    .sort((a, b) => a.name.localeCompare(b.name))
    .flatMap((e) => {
      const rel = `${dir}/${e.name}`;
      if (e.isDirectory()) return rel === `native/platform/${other}` ? [] : walk(rel);
      return e.name.endsWith('.cc') ? [rel] : [];
    });
}

const files = walk('native').filter((f) => kind === 'addon' || f !== 'native/interface.cc');
process.stdout.write(files.join(' ') + '\n');
