// tidelinkpeer: the reference compositing peer (Kestrel, Osprey, Puffin or the Plover named server).
#include "PeerRuntime.h"

int main(int argc, char** argv) { return tidelink::peer::RunPeerMain(argc, argv); }
