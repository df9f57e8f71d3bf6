import './styles.css';
import { ApiClient, sessionStorageStore } from './api/client';
import { startApp } from './app';

const root = document.getElementById('app');
if (!root) throw new Error('the page has no #app element');
startApp(root, new ApiClient({ store: sessionStorageStore() }));
