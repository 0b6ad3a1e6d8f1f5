{
  'variables': {
    'linux_packages': 'libavformat libavcodec libavdevice libavutil libswscale libswresample xcb xcb-shm xcb-damage xcb-xfixes xcb-randr xcb-render libpulse dbus-1',
  },
  'targets': [{
    'target_name': 'tavio_capture',
    'sources': ['<!@(node scripts/sources.js addon)'],
    'include_dirs': ['<!(node -e "require(\'nan\')")', 'native'],
    'cflags_cc!': ['-fno-exceptions', '-fno-rtti'],
    'cflags_cc': ['-std=gnu++17', '-fexceptions', '-frtti', '-Wall', '-Wno-unused-parameter'],
    'conditions': [
      ['OS=="linux"', {
        'cflags_cc': ['<!@(pkg-config --cflags <(linux_packages))'],
        'libraries': ['<!@(pkg-config --libs <(linux_packages))', '-lpthread'],
      }],
      ['OS=="win"', {
        'defines': ['NOMINMAX', 'WIN32_LEAN_AND_MEAN', '_WIN32_WINNT=0x0A00'],
        'libraries': ['d3d11.lib', 'dxgi.lib', 'mfplat.lib', 'mfreadwrite.lib', 'mf.lib', 'mfuuid.lib',
                      'ole32.lib', 'shlwapi.lib', 'user32.lib'],
        'msvs_settings': {
          'VCCLCompilerTool': { 'ExceptionHandling': 1, 'RuntimeTypeInfo': 'true', 'AdditionalOptions': ['/std:c++17'] },
        },
      }],
    ],
  }],
}
