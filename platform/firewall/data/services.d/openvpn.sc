# VPN server (OpenVPN).
[openvpn]
title="OpenVPN"
protocol=udp
ports=1194
forwardable=yes
