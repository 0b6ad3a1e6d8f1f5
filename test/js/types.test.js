'use strict';
// The TypeScript declarations: a typed host compiles under --strict, the declarations name the
// add-on's functions exactly, and package.json points at them.
const test = require('node:test');
const assert = require('node:assert');
const { spawnSync } = require('child_process');
const path = require('path');
const ts = require('typescript');
const { root } = require('./addon');

test('TypeScript declarations', async (t) => {
  await t.test('a typed host compiles with tsc --noEmit --strict', () => {
    const tsc = require.resolve('typescript/bin/tsc');
    const r = spawnSync(process.execPath, [tsc, '--noEmit', '--strict', '--module', 'commonjs', '--target', 'es2020',
      path.join(root, 'test', 'types', 'host.ts')], { encoding: 'utf8' });
    assert.strictEqual(r.status, 0, r.stdout + r.stderr);
  });

  await t.test('the declared functions are the add-on\'s, and package.json names the file', () => {
    const file = path.join(root, 'index.d.ts');
    const program = ts.createProgram([file], { strict: true, noEmit: true });
    const checker = program.getTypeChecker();
    const declared = checker.getExportsOfModule(checker.getSymbolAtLocation(program.getSourceFile(file)))
      .filter((s) => s.flags & ts.SymbolFlags.Function).map((s) => s.name).sort();
    // Loading the add-on registers its functions; nothing starts before initialize.
    assert.deepStrictEqual(declared, Object.keys(require(root)).sort());
    assert.strictEqual(declared.length, 7);
    assert.strictEqual(require(path.join(root, 'package.json')).types, 'index.d.ts');
  });
});
