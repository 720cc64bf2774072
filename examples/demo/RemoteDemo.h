// tarn-demo --remote: a host and a plug-in process on stations shared
// through Tarn::Remote (RemoteDemo.cpp). Built where the remote library is.
//
//   if (tarn_demo::IsRemoteDemo(argc, argv)) return tarn_demo::RunRemoteDemo(argc, argv);
#pragma once

namespace tarn_demo {

// Whether the command line asks for the remote demo (--remote), or is the
// plug-in process it starts (--remote-plugin).
bool IsRemoteDemo(int inArgc, char** inArgv);

// Runs it; the exit status: 0 when every message was accounted for.
int RunRemoteDemo(int inArgc, char** inArgv);

}  // namespace tarn_demo
