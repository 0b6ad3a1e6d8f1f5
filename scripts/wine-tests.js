#!/usr/bin/env node
// Runs the Windows executables of build-windows under Wine, inside a private Wine prefix (kept in
// the build folder), Xvfb and PulseAudio:
//   unit_tests.exe  every test passes, or is skipped under Wine with its reason printed;
//   startup.exe     the add-on's start-up discovery finds the endpoints and reports, as warning
//                   lines, where Wine stops: display duplication and loopback capture.
//   node scripts/wine-tests.js [build folder]
'use strict';
const { spawn, spawnSync } = require('child_process');
const fs = require('fs');
const path = require('path');
const { startDesktop } = require('./desktop');

const build = path.resolve(process.argv[2] || path.join(__dirname, '..', 'build-windows'));
const wineEnv = {
  ...process.env,
  WINEPREFIX: path.join(build, 'wineprefix'),
  WINEDEBUG: '-all',
  WINEDLLOVERRIDES: 'mscoree,mshtml=',  // no Mono or Gecko installer prompts in a new prefix
};

function fail(message) {
  console.log(`wine: ${message}`);
  process.exitCode = 1;
}

// Runs a program under Wine until `done(output)` says so (then it is ended) or it exits.
function runWine(env, program, args, { done = () => false, timeout = 120000 } = {}) {
  return new Promise((resolve) => {
    const child = spawn('wine', [program, ...args], { env, stdio: ['ignore', 'pipe', 'pipe'] });
    let output = '';
    let ended = false;
    const end = (why) => {
      if (ended) return;
      ended = why;
      child.kill('SIGTERM');
    };
    const timer = setTimeout(() => end('timeout'), timeout);
    const take = (data) => {
      output += data;
      if (done(output)) end('done');
    };
    child.stdout.on('data', take);
    child.stderr.on('data', take);
    child.on('close', (code) => {
      clearTimeout(timer);
      resolve({ code, output, ended });
    });
  });
}

// Each skipped test with the reason it printed; a skip without a reason is an error.
function checkUnitTests({ code, output, ended }) {
  process.stdout.write(output.split('\n').filter((l) => /^\[  (FAILED|PASSED|SKIPPED) |^\[==========\]/.test(l)).join('\n') + '\n');
  if (ended) return fail(`unit_tests.exe did not finish (${ended})`);
  let current = null;
  let lines = [];
  for (const line of output.split('\n')) {
    const run = /^\[ RUN      \] (\S+)/.exec(line);
    if (run) {
      current = run[1];
      lines = [];
      continue;
    }
    if (new RegExp(`^\\[  SKIPPED \\] ${current} \\(`).test(line)) {
      const at = lines.findIndex((l) => /: Skipped$/.test(l));
      const reason = at >= 0 ? lines.slice(at + 1).join(' ').trim() : '';
      if (reason) console.log(`wine: skipped ${current}: ${reason}`);
      else fail(`${current} was skipped without a reason`);
    }
    lines.push(line.replace(/\r$/, ''));
  }
  if (code !== 0) fail(`unit_tests.exe exited with ${code}`);
  const passed = /^\[  PASSED  \] (\d+) test/m.exec(output);
  if (!passed || Number(passed[1]) === 0) fail('unit_tests.exe passed no test');
}

// The lines where Wine stops the capture code, in the add-on's own failure form.
const duplicationLine = /^(?:\d+: Warning: )?\w{3} \w{3} [ \d]\d \d\d:\d\d:\d\d \d{4}\n\tnative\/capture\/video\/screen\/dxgi\/duplicate\(10\): 0x80004001: Could not get output duplicator from device\. \(.*\)$/m;
const loopbackLine = /^\d{13}: Warning: \w{3} \w{3} [ \d]\d \d\d:\d\d:\d\d \d{4}\n\tnative\/capture\/audio\/wasapi\/source\(243\): 0x88890003: Could not get the audio capture client service from the audio client\. \(.*\)$/gm;
const endpointLine = /^source id=\d+ name=".+" selected=[01] type="wasapi"$/gm;

function startupSeen(raw) {
  const output = raw.replace(/\r\n/g, '\n');
  const endpoints = (output.match(endpointLine) || []).length;
  return /^discovery done$/m.test(output) && duplicationLine.test(output) && endpoints > 0 && (output.match(loopbackLine) || []).length >= endpoints;
}

function checkStartup({ output, ended }) {
  const text = output.replace(/\r\n/g, '\n');
  process.stdout.write(text.split('\n').map((l) => `  | ${l}`).join('\n') + '\n');
  const endpoints = (text.match(endpointLine) || []).length;
  const loopbacks = (text.match(loopbackLine) || []).length;
  if (!/^source id=\d+ name=".+" selected=1 type="wasapi"$/m.test(text)) fail('start-up found no default endpoint');
  if (!duplicationLine.test(text)) fail('start-up printed no display duplication failure (E_NOTIMPL)');
  if (loopbacks < endpoints) fail(`start-up printed ${loopbacks} loopback capture warnings for ${endpoints} endpoints`);
  if (ended !== 'done') fail(`start-up ended before it printed all that (${ended || 'it exited'})`);
  else console.log(`wine: start-up found ${endpoints} endpoints; display duplication and loopback capture failed with warning lines`);
}

async function main() {
  for (const exe of ['unit_tests.exe', 'startup.exe']) {
    if (!fs.existsSync(path.join(build, exe))) throw new Error(`${exe} is not built in ${build}`);
  }
  if (!fs.existsSync(path.join(wineEnv.WINEPREFIX, 'system.reg'))) {
    const boot = spawnSync('wine', ['wineboot', '--init'], { env: wineEnv, encoding: 'utf8' });
    if (boot.status !== 0) throw new Error(`wineboot failed: ${boot.stderr}`);
  }
  const desktop = await startDesktop({ private: true });
  const env = { ...wineEnv, ...desktop.env };
  try {
    checkUnitTests(await runWine(env, path.join(build, 'unit_tests.exe'), ['--gtest_color=no']));
    checkStartup(await runWine(env, path.join(build, 'startup.exe'), [], { done: startupSeen, timeout: 60000 }));
  } finally {
    spawnSync('wineserver', ['-k'], { env: wineEnv });
    desktop.stop();
  }
}

main().catch((e) => {
  console.log(`wine: ${e.message}`);
  process.exitCode = 1;
});
