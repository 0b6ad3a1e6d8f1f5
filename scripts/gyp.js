#!/usr/bin/env node
// Runs node-gyp offline: when the running Node ships its own headers (a distribution install
// such as /usr/include/node), point node-gyp at them instead of letting it download a tarball.
// An explicit --nodedir, npm_config_nodedir or an Electron rebuild's own settings win.
'use strict';
const { spawnSync } = require('child_process');
const fs = require('fs');
const path = require('path');

const args = process.argv.slice(2);
const prefix = path.resolve(path.dirname(process.execPath), '..');
const explicit = args.some((a) => a.startsWith('--nodedir')) || process.env.npm_config_nodedir;
if (!explicit && fs.existsSync(path.join(prefix, 'include', 'node', 'node.h'))) {
  args.push(`--nodedir=${prefix}`);
}

function nodeGyp() {
  try {
    return require.resolve('node-gyp/bin/node-gyp.js');
  } catch (_) {
    // npm carries its own copy of node-gyp.
    const npmDir = path.join(prefix, 'lib', 'node_modules', 'npm', 'node_modules', 'node-gyp', 'bin', 'node-gyp.js');
    if (fs.existsSync(npmDir)) return npmDir;
    return process.env.npm_config_node_gyp || 'node-gyp';
  }
}

const gyp = nodeGyp();
const cmd = gyp.endsWith('.js') ? [process.execPath, [gyp, ...args]] : [gyp, args];
const r = spawnSync(cmd[0], cmd[1], { stdio: 'inherit', cwd: path.resolve(__dirname, '..') });
process.exit(r.status === null ? 1 : r.status);
