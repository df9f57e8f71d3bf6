# Windows file sharing. Meant for the local network only: never forwarded
# to the internet.
[smb]
title="Windows file sharing"
protocol=tcp
ports=445,139
forwardable=no

[smb_netbios]
title="Windows file sharing (NetBIOS name and datagram)"
protocol=udp
ports=137-138
forwardable=no
