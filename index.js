'use strict';
// The add-on's seven functions, as the native module registers them.
module.exports = require('./build/Release/tavio_capture.node');
